#include "Support.h"

#include <fcntl.h>
#include <netinet/in.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>

#include "remote/ScriptServer.h"

namespace Korvel::Test {
namespace {

constexpr char kNoTool[] = "/nonexistent";

std::string ReadFile(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    std::stringstream content;
    content << file.rdbuf();
    return content.str();
}

bool IsFree(unsigned int port) {
    bool isFree = true;
    for (int type : {SOCK_STREAM, SOCK_DGRAM}) {
        int socket = ::socket(AF_INET, type | SOCK_CLOEXEC, 0);
        sockaddr_in address = {};
        address.sin_family = AF_INET;
        address.sin_port = htons(static_cast<uint16_t>(port));
        isFree =
            isFree && bind(socket, reinterpret_cast<sockaddr*>(&address), sizeof(address)) == 0;
        close(socket);
    }
    return isFree;
}

void SetServerPort(unsigned int port) {
    setenv("KORVEL_ScriptServerPort", std::to_string(port).c_str(), 1);
    g_ScriptServerPort = port;
}

// Ahead of all code that starts something.
[[gnu::constructor]] void SetUpServer() {
    SetServerPort(FreePort());
    setenv("KORVEL_Tool", kNoTool, 0);
}

std::vector<char*> Pointers(const std::vector<std::string>& texts) {
    std::vector<char*> pointers;
    for (const std::string& text : texts) pointers.push_back(const_cast<char*>(text.c_str()));
    pointers.push_back(nullptr);
    return pointers;
}

}  // namespace

unsigned int FreePort() {
    constexpr unsigned int kFirst = 20000, kCount = 10000;
    static unsigned int s_Next = static_cast<unsigned int>(getpid());
    unsigned int port;
    do {
        port = kFirst + s_Next++ % kCount;
    } while (!IsFree(port));
    return port;
}

ServerTool::ServerTool(const char* program) {
    SetServerPort(FreePort());
    setenv("KORVEL_Tool", program, 1);
}

ServerTool::~ServerTool() {
    setenv("KORVEL_Tool", kNoTool, 1);
}

TempDir::TempDir() {
    std::string path = std::filesystem::temp_directory_path() / "korvelscript-XXXXXX";
    if (!mkdtemp(path.data())) throw std::runtime_error("no temporary directory");
    m_Path = path;
}

TempDir::~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(m_Path, ignored);
}

std::string TempDir::Write(const std::string& name, const std::string& content) const {
    std::ofstream(Path(name), std::ios::binary) << content;
    return Path(name);
}

ProcessResult RunProcess(const std::vector<std::string>& argv,
                         const std::vector<std::string>& settings) {
    TempDir dir;
    std::vector<std::string> environment = settings;
    for (char** entry = environ; *entry; entry++) environment.push_back(*entry);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    const int flags = O_WRONLY | O_CREAT;
    posix_spawn_file_actions_addopen(&actions, 0, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, 1, dir.Path("out").c_str(), flags, 0600);
    posix_spawn_file_actions_addopen(&actions, 2, dir.Path("err").c_str(), flags, 0600);
    pid_t pid = 0;
    int error = posix_spawnp(&pid, argv[0].c_str(), &actions, nullptr, Pointers(argv).data(),
                             Pointers(environment).data());
    posix_spawn_file_actions_destroy(&actions);
    if (error != 0) throw std::runtime_error("cannot start " + argv[0]);

    int status = 0;
    while (waitpid(pid, &status, 0) < 0 && errno == EINTR) continue;
    return {WIFEXITED(status) ? WEXITSTATUS(status) : -1 - WTERMSIG(status),
            ReadFile(dir.Path("out")), ReadFile(dir.Path("err"))};
}

HostProcess::HostProcess(const char* program, const char* option, const char* value) {
    int ends[2];
    if (pipe2(ends, O_CLOEXEC) != 0) throw std::runtime_error("no pipe");
    m_Process = fork();
    if (m_Process == 0) {
        dup2(ends[1], STDOUT_FILENO);
        setenv("KORVEL_ListenAddress", "127.0.0.1", 0);
        execl(program, program, option, value, nullptr);
        _exit(127);
    }
    close(ends[1]);
    FILE* out = fdopen(ends[0], "r");
    if (fscanf(out, "%u", &m_Port) != 1) m_Port = 0;
    fclose(out);
}

HostProcess::~HostProcess() {
    if (m_Process > 0) End(SIGKILL);
}

int HostProcess::End(int signal) {
    int status = 0;
    kill(m_Process, signal);
    while (waitpid(m_Process, &status, 0) < 0 && errno == EINTR) continue;
    m_Process = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1 - WTERMSIG(status);
}

}  // namespace Korvel::Test
