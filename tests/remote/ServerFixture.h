#pragma once

// A script server as a process, and what its tests play: hosts, clients, and others.
#include <sys/types.h>

#include <string>
#include <vector>

#include "Platform/Networking.h"
#include "RemoteFixture.h"
#include "Support.h"

namespace Korvel::Test {

class ServerProcess {
public:
    explicit ServerProcess(unsigned int port = FreePort(), const char* exitDelay = "300");
    ServerProcess(const ServerProcess&) = delete;
    ServerProcess& operator=(const ServerProcess&) = delete;
    ~ServerProcess();  // kills it

    unsigned int GetPort() const { return m_Port; }
    pid_t GetProcess() const { return m_Process; }

    // Reads lines up to one that has `text` in it. False when the output has ended before.
    bool AwaitLine(const std::string& text);
    int AwaitEnd();  // its status, as RunProcess gives it

    Platform::_Socket* Call() const;  // a new connection, the caller's
    ScriptVal Connect() const;        // the same as a proxy of the server
    // A datagram, and the answer to it as text; empty when none has come before that of a second,
    // good one.
    std::string Ask(const std::string& datagram) const;

private:
    const unsigned int m_Port;
    pid_t m_Process = 0;
    FILE* m_Out = nullptr;
};

// A table with these entries.
ScriptVal Table(std::initializer_list<std::pair<const char*, ScriptVal>> entries);

}  // namespace Korvel::Test
