#pragma once

#include <sys/types.h>

#include <string>
#include <vector>

namespace Korvel::Test {

// A directory of the test's own, removed with all that is in it.
class TempDir {
public:
    TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;
    ~TempDir();

    std::string Path(const std::string& name) const { return m_Path + "/" + name; }

    // Writes a file and returns its path.
    std::string Write(const std::string& name, const std::string& content) const;

private:
    std::string m_Path;
};

// A port of this machine that nobody has, for TCP and UDP, and that the system gives to nobody by
// itself. Each test process looks at other ones first, and has one of them as the port of its
// script server.
unsigned int FreePort();

// While it lives, hosts start this program as their script server, at a port that no other test
// has. Without it they run without a server.
class ServerTool {
public:
    explicit ServerTool(const char* program);
    ServerTool(const ServerTool&) = delete;
    ServerTool& operator=(const ServerTool&) = delete;
    ~ServerTool();
};

// What a finished process has left behind.
struct ProcessResult {
    int m_Status;  // exit status, or -1 - signal when a signal ended it
    std::string m_Out;
    std::string m_Err;
};

// Runs a program with its arguments and waits for its end. `settings` ("NAME=value") are added to
// its environment.
ProcessResult RunProcess(const std::vector<std::string>& argv,
                         const std::vector<std::string>& settings = {});

// The example host, as a process.
class HostProcess {
public:
    explicit HostProcess(const char* program, const char* option = nullptr,
                         const char* value = nullptr);
    HostProcess(const HostProcess&) = delete;
    HostProcess& operator=(const HostProcess&) = delete;
    ~HostProcess();  // kills it

    unsigned int GetPort() const { return m_Port; }  // 0 when it has not started
    // Sends a signal and waits for the end. Returns its status as RunProcess does.
    int End(int signal);

private:
    pid_t m_Process;
    unsigned int m_Port = 0;
};

}  // namespace Korvel::Test
