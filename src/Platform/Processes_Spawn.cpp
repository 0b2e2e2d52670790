// Starting other programs.
#include <dirent.h>
#include <fcntl.h>
#include <limits.h>
#include <signal.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <string>
#include <vector>

#include "Platform/MutexInternal.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Processes.h"
#include "Platform/ProcessesInternal.h"

namespace Korvel::Platform {
namespace {

_Process* ToProcess(pid_t id) {
    return reinterpret_cast<_Process*>(static_cast<intptr_t>(id));
}
pid_t ToID(const _Process* process) {
    return static_cast<pid_t>(reinterpret_cast<intptr_t>(process));
}

// What a new process has of this one: its environment, its working directory unless told otherwise,
// the three standard streams, and nothing else.
class Spawner {
public:
    Spawner() {
        posix_spawn_file_actions_init(&m_Actions);
        posix_spawnattr_init(&m_Attributes);
        // A thread of ours may block signals, and SIGPIPE is ignored for the sake of sockets.
        sigset_t signals;
        sigemptyset(&signals);
        posix_spawnattr_setsigmask(&m_Attributes, &signals);
        sigaddset(&signals, SIGPIPE);
        posix_spawnattr_setsigdefault(&m_Attributes, &signals);
        posix_spawn_file_actions_addclosefrom_np(&m_Actions, STDERR_FILENO + 1);
    }
    Spawner(const Spawner&) = delete;
    Spawner& operator=(const Spawner&) = delete;
    ~Spawner() {
        posix_spawn_file_actions_destroy(&m_Actions);
        posix_spawnattr_destroy(&m_Attributes);
    }

    bool SetFolder(const char* folder) {
        return Is(posix_spawn_file_actions_addchdir_np(&m_Actions, folder));
    }
    // The process has no part in what this one's terminal and streams are used for.
    bool Detach() {
        m_Flags |= POSIX_SPAWN_SETSID;
        return Is(posix_spawn_file_actions_addopen(&m_Actions, 0, "/dev/null", O_RDWR, 0)) &&
               Is(posix_spawn_file_actions_adddup2(&m_Actions, 0, 1)) &&
               Is(posix_spawn_file_actions_adddup2(&m_Actions, 0, 2));
    }

    // 0, with errno set, when it cannot be started.
    pid_t Start(decltype(posix_spawn)* spawn, const char* program, char* const* arguments) {
        NoKill noKill;
        ObtainEnvLock();
        pid_t id = 0;
        posix_spawnattr_setflags(&m_Attributes, m_Flags);
        int error = spawn(&id, program, &m_Actions, &m_Attributes, arguments, GetEnviron());
        ReleaseEnvLock();
        return Is(error) ? id : 0;
    }

private:
    static bool Is(int error) {
        if (error) errno = error;
        return error == 0;
    }

    posix_spawn_file_actions_t m_Actions;
    posix_spawnattr_t m_Attributes;
    short m_Flags = POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF;
};

// Cuts a command line where Processes.h says, in its own memory.
std::vector<char*> CutCommandLine(std::string& text) {
    std::vector<char*> arguments;
    bool isQuoted = false;
    size_t start = 0;
    auto end = [&](size_t at) {
        text[at] = 0;
        arguments.push_back(&text[start]);
        start = at + 1;
    };
    for (size_t i = 0; i < text.size(); i++) {
        if (text[i] == ' ' && !isQuoted) {
            end(i);
        } else if (text[i] == '"' && !isQuoted) {
            isQuoted = true;
            if (i == start) start = i + 1;
        } else if (text[i] == '"') {
            isQuoted = false;
            end(i);
            if (text[start] == ' ') i = start++;
        }
    }
    if (start < text.size()) arguments.push_back(&text[start]);
    if (!arguments.empty()) arguments.push_back(nullptr);
    return arguments;
}

// Waits for a child; false when there is none with this id.
bool AwaitChild(pid_t id, int& status) {
    pid_t found;
    do {
        found = waitpid(id, &status, 0);
    } while (found < 0 && errno == EINTR);
    return found == id;
}

bool Exists(const char* name) {
    struct stat status;
    return stat(name, &status) == 0;
}

}  // namespace

_Process* NewProcess(const char* commandLine, const char* folder, unsigned int,
                     unsigned long long* idOut) {
    std::string text = commandLine ? commandLine : "";
    std::vector<char*> arguments = CutCommandLine(text);
    Spawner spawner;
    if (arguments.empty() || !*arguments[0]) {
        RefuseArgument();
        return nullptr;
    }
    if (folder && !spawner.SetFolder(folder)) return nullptr;
    const char* program = arguments[0];
    bool isPath = folder || strpbrk(program, "/\\") || Exists(program);
    pid_t id = spawner.Start(isPath ? posix_spawn : posix_spawnp, program, arguments.data());
    if (!id) return nullptr;
    if (idOut) *idOut = static_cast<unsigned long long>(id);
    return ToProcess(id);
}

bool StartDetached(const char* program, const char* argument, const char* folder) {
    // The shell is the program's parent, and ends at once. As a child of ours it would have to be
    // waited for, by us and not by a host that waits for all of its own.
    const char* arguments[] = {"sh", "-c", "\"$0\" \"$1\" &", program, argument, nullptr};
    Spawner spawner;
    if (!spawner.SetFolder(folder) || !spawner.Detach()) return false;
    pid_t id = spawner.Start(posix_spawn, "/bin/sh", const_cast<char* const*>(arguments));
    int status = 0;
    // A host that ignores SIGCHLD, or waits for whatever there is, leaves nothing to wait for.
    return id && (!AwaitChild(id, status) || status == 0);
}

bool IsChildRunning(unsigned long long id) {
    siginfo_t info = {};
    return waitid(P_PID, static_cast<id_t>(id), &info, WEXITED | WNOHANG | WNOWAIT) == 0 &&
           info.si_pid == 0;
}

void ReapChild(unsigned long long id) {
    waitpid(static_cast<pid_t>(id), nullptr, WNOHANG);
}

unsigned int WaitProcess(_Process* process, unsigned int) {
    int status;
    if (!process || !AwaitChild(ToID(process), status)) return 0xFFFFFFFF;
    return WIFEXITED(status) ? static_cast<unsigned int>(WEXITSTATUS(status)) : 0;
}

void DeleteProcess(_Process*) {}

unsigned long long GetCurrentProcessID() {
    return static_cast<unsigned long long>(getpid());
}
_Process* GetCurrentProcess() {
    return ToProcess(getpid());
}
unsigned long long GetProcessID(_Process* process) {
    return static_cast<unsigned long long>(ToID(process));
}

unsigned long long FindProcessID(const char* name) {
    if (!name) return 0;
    unsigned long long found = 0;
    DIR* folder = opendir("/proc");
    while (dirent* entry = folder && !found ? readdir(folder) : nullptr) {
        if (entry->d_name[0] < '0' || entry->d_name[0] > '9') continue;
        std::ifstream file(std::string("/proc/").append(entry->d_name).append("/comm"));
        std::string comm;
        if (std::getline(file, comm) && comm == name) found = strtoull(entry->d_name, nullptr, 10);
    }
    if (folder) closedir(folder);
    return found;
}

bool TerminateProcessID(unsigned long long id) {
    return id != 0 && id <= INT_MAX && kill(static_cast<pid_t>(id), SIGKILL) == 0;
}

}  // namespace Korvel::Platform
