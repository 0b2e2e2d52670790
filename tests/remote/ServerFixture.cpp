#include "ServerFixture.h"

#include <fcntl.h>
#include <sys/wait.h>
#include <unistd.h>

#include <csignal>
#include <cstdlib>

#include "remote/ScriptApp.h"

namespace Korvel::Test {

using Platform::_Socket;

ServerProcess::ServerProcess(unsigned int port, const char* exitDelay) : m_Port(port) {
    int ends[2];
    EXPECT_EQ(pipe2(ends, O_CLOEXEC), 0);
    std::string portText = std::to_string(port);
    m_Process = fork();
    if (m_Process == 0) {
        dup2(ends[1], STDOUT_FILENO);
        setenv("KORVEL_ScriptServerPort", portText.c_str(), 1);
        setenv("KORVEL_ScriptServerExitDelay", exitDelay, 1);
        setenv("KORVEL_ListenAddress", "127.0.0.1", 1);
        setenv("USER", "tester", 1);
        execl(OXSCRIPT, OXSCRIPT, "-s", nullptr);
        _exit(127);
    }
    close(ends[1]);
    m_Out = fdopen(ends[0], "r");
}

ServerProcess::~ServerProcess() {
    fclose(m_Out);
    if (!m_Process) return;
    kill(m_Process, SIGKILL);
    AwaitEnd();
}

bool ServerProcess::AwaitLine(const std::string& text) {
    char line[1024];
    while (fgets(line, sizeof line, m_Out)) {
        if (std::string(line).find(text) != std::string::npos) return true;
    }
    return false;
}

int ServerProcess::AwaitEnd() {
    int status = 0;
    while (waitpid(m_Process, &status, 0) < 0 && errno == EINTR) continue;
    m_Process = 0;
    return WIFEXITED(status) ? WEXITSTATUS(status) : -1 - WTERMSIG(status);
}

_Socket* ServerProcess::Call() const {
    _Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    EXPECT_TRUE(Platform::ConnectSocket(socket, m_Port, kLoopback));
    return socket;
}

ScriptVal ServerProcess::Connect() const {
    ScriptVal server = ScriptApp(Call(), "server", ScriptVal());
    EXPECT_TRUE(server.IsRemoteObject());
    server.GetApp()->SetTimeOut(kLimitMs / 1000);
    return server;
}

// One server serves them in turn, so what comes first tells whether the first one had an answer.
std::string ServerProcess::Ask(const std::string& datagram) const {
    _Socket* socket = Platform::NewSocket(Platform::ST_UDP);
    Platform::_SocketAddress* to = Platform::NewSocketAddress(m_Port, kLoopback);
    auto send = [&](const std::string& bytes) {
        Platform::SocketSendTo(socket, bytes.data(), static_cast<int>(bytes.size()), to);
    };
    char bytes[2048];
    auto receive = [&]() -> std::string {
        return {bytes, Platform::SocketReceive(socket, bytes, sizeof bytes, nullptr, nullptr)};
    };
    send(datagram);
    send("SPP:");
    std::string first = receive();
    std::string second = first.find("Hosts = {") == std::string::npos || datagram == "SPP:"
                             ? receive()
                             : std::string();
    Platform::DeleteSocketAddress(to);
    Platform::DeleteSocket(socket);
    return second.empty() ? second : first;
}

ScriptVal Table(std::initializer_list<std::pair<const char*, ScriptVal>> entries) {
    ScriptVal table(SV_Table, nullptr);
    for (const auto& [key, value] : entries) table[key] = value;
    return table;
}

}  // namespace Korvel::Test
