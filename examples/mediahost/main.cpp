// A small media application without a window, for scripts in other processes, which find it by the
// name "MediaHost". It prints the port at which it can be reached, and runs until it gets SIGINT or
// SIGTERM, or a script calls app:Quit().
//
// Build it against the installed library:
//   g++ -std=c++20 *.cpp $(pkg-config --cflags --libs korvelscript)
#include <cmath>
#include <csignal>
#include <cstdio>
#include <cstdlib>
#include <cstring>

#include "MediaHost.h"
#include "UIThread.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"

using namespace Korvel;

static constexpr char kUsage[] =
    "Usage: mediahost [--debug] [--priority N]\n"
    "Prints the port at which scripts reach it, and runs until SIGINT or SIGTERM. Scripts find it "
    "by\n"
    "the name MediaHost; the script server of this machine is started when it does not run.\n"
    "  --debug       with the members that are for debugging\n"
    "  --priority N  of several, the one with the highest is what scripts get that ask for the\n"
    "                subtype 'render': orv.scriptapp('MediaHost', nil, 5, nil, 'render')\n"
    "In the environment: KORVEL_ListenAddress is the address to listen at, any by default; "
    "127.0.0.1\n"
    "keeps other machines out. KORVEL_ScriptServerPort is the port of the script server.\n";

static UIThread* s_UIThread;
static bool s_IsDebug = false;
static double s_Priority = NAN;  // none

// False where the command line makes no sense.
static bool ReadOptions(int argc, char** argv) {
    for (int i = 1; i < argc; i++) {
        if (strcmp(argv[i], "--debug") == 0) {
            s_IsDebug = true;
        } else if (strcmp(argv[i], "--priority") == 0 && i + 1 < argc) {
            char* end;
            s_Priority = strtod(argv[++i], &end);
            if (*end || end == argv[i]) return false;
        } else {
            return false;
        }
    }
    return true;
}

// What the script server is told, besides the name, the process and the port.
static ScriptVal GetHostInfo(const MediaHost& host) {
    ScriptVal info(SV_Table, nullptr);
    info["PingInfo"] = host.GetPingInfo();
    if (!std::isnan(s_Priority)) {
        info["Priorities"] = SV_Table;
        info["Priorities"]["render"] = s_Priority;
    }
    return info;
}

// The set of signals that end the application, which only the main thread waits for.
static sigset_t BlockSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    return signals;
}

int main(int argc, char** argv) {
    if (argc == 2 && strcmp(argv[1], "--help") == 0) {
        fputs(kUsage, stdout);
        return 0;
    }
    if (!ReadOptions(argc, argv)) {
        fputs(kUsage, stderr);
        return 2;
    }
    sigset_t signals = BlockSignals();
    UIThread thread;
    s_UIThread = &thread;
    ptr<MediaHost> host(new MediaHost);

    // All that the library asks of a host.
    static ScriptConfig config;
    config.m_Flags = SCF_Host | SCF_Standard;
    config.m_AppName = "MediaHost";
    config.m_UserData = host.Get();
    config.GetApp = [](void* app, TagList*) -> ScriptObject* {
        return static_cast<MediaHost*>(app);
    };
    config.IsDebugMode = [](void*, TagList*) { return s_IsDebug; };
    config.OnDisconnect = [](void*, RemoteApp* app, TagList*) {
        fprintf(stderr, "mediahost: %s has gone\n", static_cast<const char*>(app->GetName()));
    };
    config.UIExecute = [](ScriptConfig::UIFunction function, void* a, void* b, bool wait) {
        return s_UIThread->Execute(function, a, b, wait);
    };
    g_NoGUI = false;  // there is a UI thread: members run there

    _InitScripting(config);
    if (!StartScripting(GetHostInfo(*host.Get())) || !GetListenPort()) {
        fprintf(stderr,
                "mediahost: cannot listen; is KORVEL_ListenAddress an address of this machine?\n");
        return 1;
    }
    printf("%u\n", GetListenPort());
    fflush(stdout);

    int signal;
    sigwait(&signals, &signal);
    CleanupScripting();
    return 0;
}
