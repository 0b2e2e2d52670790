#include "tools/oxscript/Application.h"

#include <charconv>
#include <chrono>

#include "Platform/Networking.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"

namespace Korvel::Oxscript {
namespace {

constexpr double kConnectSeconds = 10;
const unsigned int kThisMachine = RemoteApp::IPFromStr("127.0.0.1");

bool IsSomebodyThere(unsigned int port) {
    Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    bool isThere = Platform::ConnectSocket(socket, port, kThisMachine);
    Platform::DeleteSocket(socket);
    return isThere;
}

// Why there is no connection, as far as it shows.
const char* Explain(unsigned int port, double seconds) {
    if (seconds >= kConnectSeconds) return "whoever listens there does not answer";
    if (!IsSomebodyThere(port)) return "nobody listens there";
    return "whoever listens there refuses, or is no such application";
}

}  // namespace

bool ReadPort(const std::string& text, unsigned int& port) {
    const char* end = text.data() + text.size();
    std::from_chars_result read = std::from_chars(text.data(), end, port);
    return read.ec == std::errc() && read.ptr == end && port > 0 && port < 65536;
}

ScriptVal ConnectApplication(unsigned int port, std::string& error) {
    static ScriptConfig s_Config;
    s_Config.m_AppName = "oxscript";
    InitScripting(s_Config);
    StartScripting(ScriptVal());

    ScriptVal reply;
    auto start = std::chrono::steady_clock::now();
    ScriptVal app = ScriptApp(kThisMachine, port, reply, kConnectSeconds);
    std::chrono::duration<double> taken = std::chrono::steady_clock::now() - start;
    if (app.IsNil()) {
        error = "no application at port ";
        error.append(std::to_string(port)).append(": ").append(Explain(port, taken.count()));
    } else {
        app.GetApp()->SetTimeOut(0);  // scripts set their own
    }
    return app;
}

std::string TakePendingErrors() {
    std::string lines;
    auto take = [](void* result, RemoteApp& app) {
        OxStringT<char> text;
        if (!app.TakeLastError(text)) return;
        std::string& all = *static_cast<std::string*>(result);
        all += app.GetName();
        all += ": ";
        all += text;
        all += '\n';
    };
    ForEachApp(take, &lines);
    return lines;
}

}  // namespace Korvel::Oxscript
