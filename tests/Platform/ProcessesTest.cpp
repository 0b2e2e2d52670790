#include "Platform/Processes.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <string>
#include <utility>

#include "Platform/Files.h"
#include "Platform/ProcessesInternal.h"
#include "Platform/Time.h"
#include "Support.h"

namespace Korvel::Platform {
namespace {

using Test::TempDir;

constexpr int kLeakedFile = 700;

std::string Read(const std::string& path) {
    std::ifstream file(path);
    return std::string(std::istreambuf_iterator<char>(file), {});
}

// A shell script that can be executed.
class Program : public TempDir {
public:
    Program(const std::string& name, const std::string& body) {
        chmod(Write(name, "#!/bin/sh\n" + body + "\n").c_str(), 0700);
    }
    _Process* Start(const std::string& commandLine, unsigned long long* id = nullptr) const {
        return NewProcess(commandLine.c_str(), Path("").c_str(), 0, id);
    }
};

// In a process of its own, since a hard limit cannot be raised again.
TEST(InitProcess, RaisesTheLimitOfFilesAsFarAsItMay) {
    for (rlim_t hard : {1024, 10001}) {
        auto body = [&] {
            rlimit files = {256, hard};
            if (setrlimit(RLIMIT_NOFILE, &files) != 0) _exit(7);  // we may have fewer ourselves
            umask(022);
            InitProcess();
            getrlimit(RLIMIT_NOFILE, &files);
            raise(SIGPIPE);
            _exit(files.rlim_cur == std::min<rlim_t>(hard, 10000) && umask(0) == 0 ? 7 : 1);
        };
        EXPECT_EXIT(body(), testing::ExitedWithCode(7), "") << hard;
    }
}

TEST(NewProcess, CutsTheCommandLine) {
    Program program("two words", "for a; do printf '<%s>' \"$a\"; done > out");
    const std::pair<const char*, const char*> cases[] = {
        {"", ""},
        {" one", "<one>"},
        {"one", "<one>"},  // the closing quote has ended the name
        {" a  b", "<a><><b>"},
        {" a ", "<a>"},
        {" \"a b\" c", "<a b><c>"},
        {" \"a b\"c", "<a b><c>"},
        {" a\"b c\"d", "<a\"b c><d>"},
        {" \"\" \"\"", "<><>"},
        {" \"a b", "<a b>"},
        {" $HOME;'*", "<$HOME;'*>"},
    };
    for (auto [rest, expected] : cases) {
        _Process* process = program.Start(std::string("\"two words\"").append(rest));
        EXPECT_EQ(WaitProcess(process, 0), 0u);
        EXPECT_EQ(Read(program.Path("out")), expected) << rest;
    }
}

TEST(NewProcess, TellsHowItEnded) {
    Program program("end", "exit $1");
    unsigned long long id = 0;
    _Process* process = program.Start("end 255", &id);
    EXPECT_EQ(GetProcessID(process), id);
    EXPECT_EQ(WaitProcess(process, 0), 255u);
    EXPECT_EQ(WaitProcess(process, 0), 0xFFFFFFFF) << "it has been waited for";
    EXPECT_EQ(WaitProcess(nullptr, 0), 0xFFFFFFFF);
    for (const char* none : {"", " ", "\"\"", "missing", "true"}) {  // PATH has the last one
        EXPECT_EQ(program.Start(none, &id), nullptr) << none;
    }
    EXPECT_EQ(NewProcess(nullptr, nullptr, 0, nullptr), nullptr);
    EXPECT_EQ(NewProcess("true", program.Path("none").c_str(), 0, nullptr), nullptr);
    EXPECT_EQ(WaitProcess(NewProcess("true", nullptr, 0, nullptr), 0), 0u);
    EXPECT_EQ(NewProcess("./true", nullptr, 0, nullptr), nullptr);
    Program here("true", "exit 9");
    auto body = [&] {
        _exit(chdir(here.Path("").c_str()) == 0
                  ? static_cast<int>(WaitProcess(NewProcess("true", nullptr, 0, nullptr), 0))
                  : 1);
    };
    EXPECT_EXIT(body(), testing::ExitedWithCode(9), "") << "before what is in PATH";
}

// Signals that a thread of the host blocks, and files that it has not marked, stay with the host.
TEST(NewProcess, PassesOnNothingByMistake) {
    Program program("look", "test ! -e /proc/self/fd/700 || exit 1; kill -TERM $$; exit 2");
    int leaked = fcntl(0, F_DUPFD, kLeakedFile);
    sigset_t blocked, before;
    sigemptyset(&blocked);
    sigaddset(&blocked, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &blocked, &before);
    EXPECT_EQ(WaitProcess(program.Start("look"), 0), 0u);
    pthread_sigmask(SIG_SETMASK, &before, nullptr);
    close(leaked);
}

TEST(StartDetached, LeavesTheProcessToItself) {
    Program program("daemon", R"sh(
read -r _ _ _ parent _ session _ < /proc/$$/stat
echo "$1 $parent $session $(pwd -P) $(readlink /proc/$$/fd/1) $(ls /proc/$$/fd | grep -c 700)" > part
mv part done)sh");
    int leaked = fcntl(0, F_DUPFD, kLeakedFile);
    std::string folder = std::filesystem::canonical(program.Path(""));
    ASSERT_TRUE(StartDetached(program.Path("daemon").c_str(), "-s", folder.c_str()));
    close(leaked);
    EXPECT_EQ(waitpid(-1, nullptr, WNOHANG), -1) << "a host that waits for all has nothing of it";
    while (!std::filesystem::exists(program.Path("done"))) Wait(1);
    std::ifstream file(program.Path("done"));
    std::string argument, workingFolder, output;
    int parent = 0, session = 0, numLeaked = 1;
    file >> argument >> parent >> session >> workingFolder >> output >> numLeaked;
    EXPECT_EQ(argument, "-s");
    EXPECT_NE(parent, getpid());
    EXPECT_NE(session, getsid(0));
    EXPECT_EQ(workingFolder, folder);
    EXPECT_EQ(output, "/dev/null");
    EXPECT_EQ(numLeaked, 0);
    EXPECT_FALSE(StartDetached("/bin/true", "-s", program.Path("none").c_str()));
}

TEST(FindProcessID, FindsAProcessByItsName) {
    std::string name = "kv" + std::to_string(getpid());
    EXPECT_EQ(FindProcessID(name.c_str()), 0u);
    Program program(name, "kill -STOP $$");
    unsigned long long id = 0;
    _Process* process = program.Start(name, &id);
    EXPECT_EQ(FindProcessID(name.c_str()), id);
    EXPECT_TRUE(IsChildRunning(id));
    EXPECT_TRUE(TerminateProcessID(id));
    EXPECT_EQ(WaitProcess(process, 0), 0u) << "a signal has ended it";
    EXPECT_FALSE(IsChildRunning(id));
    EXPECT_EQ(FindProcessID(name.c_str()), 0u);
    EXPECT_EQ(FindProcessID(nullptr), 0u);
    EXPECT_FALSE(TerminateProcessID(id));
    EXPECT_FALSE(TerminateProcessID(0));
    EXPECT_FALSE(TerminateProcessID(~0ull)) << "which the system would take for all processes";
}

TEST(GetSystemFolder, KnowsTheProgram) {
    char file[kMaxPath], folder[kMaxPath];
    ASSERT_TRUE(GetAppFileName(file, sizeof(file)));
    EXPECT_EQ(GetSystemFolder(SF_Program, nullptr, 0), kMaxPath);
    ASSERT_EQ(GetSystemFolder(SF_Program, folder, sizeof(folder)), kMaxPath);
    EXPECT_EQ(std::string(folder), std::filesystem::path(file).parent_path().string() + "/");
    int length = static_cast<int>(strlen(file));
    EXPECT_FALSE(GetAppFileName(file, length));
    EXPECT_TRUE(GetAppFileName(file, length + 1));
    EXPECT_EQ(GetSystemFolder(SF_Program, folder, length), 0);
}

}  // namespace
}  // namespace Korvel::Platform
