#include "tools/oxscript/Application.h"

#include <charconv>
#include <chrono>

#include "Platform/Networking.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"
#include "tools/oxscript/Hosts.h"

namespace Korvel::Oxscript {
namespace {

constexpr double kConnectSeconds = 10;
constexpr double kPingSeconds = 1;
constexpr unsigned int kEverybody = 0xFFFFFFFF;

bool IsSomebodyThere(unsigned int port) {
    Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    bool isThere =
        Platform::ConnectSocket(socket, port, RemoteApp::IPFromStr(GetThisMachine().c_str()));
    Platform::DeleteSocket(socket);
    return isThere;
}

// Why there is no connection, as far as it shows.
const char* Explain(unsigned int port, double seconds) {
    if (seconds >= kConnectSeconds) return "whoever listens there does not answer";
    if (!IsSomebodyThere(port)) return "nobody listens there";
    return "whoever listens there refuses, or is no such application";
}

std::string Quote(const std::string& text) {
    return std::string(1, '\'').append(Clean(text)).append(1, '\'');
}

std::string ExplainHost(const std::string& name) {
    auto hosts = AskServer(GetThisMachine().c_str());
    if (!hosts) {
        return "there is no host " + Quote(name) +
               ": no script server runs on this machine, and no other one that answers knows it. "
               "Start the host, which starts the server, too.";
    }
    std::string others;
    for (const Host& host : *hosts) {
        if (host.m_Name == name) return "the host " + Quote(name) + " does not answer, or refuses";
        others += (others.empty() ? "" : ", ") + Quote(host.m_Name);
    }
    std::string error = "there is no host " + Quote(name) + "; ";
    if (others.empty()) return error + "no host is registered on this machine. Start it.";
    return error + "on this machine there is " + others + ". oxscript --hosts lists all.";
}

// No text may begin with byte 0xFF.
bool IsText(const std::string& name) {
    return !name.starts_with('\xFF');
}

ScriptVal FindHost(const std::string& name) {
    ScriptVal app =
        ScriptApp(name.c_str(), nullptr, ScriptVal(), GetThisMachine().c_str(), kConnectSeconds);
    if (!app.IsNil() || name.empty()) return app;
    ScriptVal answers;
    Ping(name.c_str(), kPingSeconds, answers, kEverybody);
    for (TableEntry* entry = nullptr; app.IsNil() && answers.NextKey(entry);) {
        const char* address = entry->m_Value.FindKeyConst("IP").ToString();
        app = ScriptApp(name.c_str(), nullptr, ScriptVal(), address, kConnectSeconds);
    }
    return app;
}

}  // namespace

bool ReadPort(const std::string& text, unsigned int& port) {
    const char* end = text.data() + text.size();
    std::from_chars_result read = std::from_chars(text.data(), end, port);
    return read.ec == std::errc() && read.ptr == end && port > 0 && port < 65536;
}

void StartClient() {
    static ScriptConfig s_Config;
    s_Config.m_AppName = "oxscript";
    InitScripting(s_Config);
    StartScripting(ScriptVal());
}

Application ConnectPort(unsigned int port) {
    Application app;
    auto start = std::chrono::steady_clock::now();
    app.m_Object = ScriptApp(RemoteApp::IPFromStr(GetThisMachine().c_str()), port, app.m_Startup,
                             kConnectSeconds);
    std::chrono::duration<double> taken = std::chrono::steady_clock::now() - start;
    if (app.m_Object.IsNil()) {
        app.m_Error = "no application at port ";
        app.m_Error.append(std::to_string(port)).append(": ").append(Explain(port, taken.count()));
        return app;
    }
    app.m_Object.GetApp()->SetTimeOut(0);                                  // scripts set their own
    for (const char* own : {"Name", "UUID"}) app.m_Startup[own] = SV_Nil;  // the peer's, not ours
    if (app.m_Startup.IsEmpty()) app.m_Startup = SV_Nil;
    return app;
}

Application ConnectHost(const std::string& name) {
    Application app;
    if (IsText(name)) app.m_Object = FindHost(name);
    if (app.m_Object.IsNil()) {
        app.m_Error = ExplainHost(name);
    } else {
        app.m_Object.GetApp()->SetTimeOut(0);
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
