// A small media application without a window, for scripts in other processes. It prints the port at
// which it can be reached, and runs until it gets SIGINT or SIGTERM, or a script calls app:Quit().
//
// Build it against the installed library:
//   g++ -std=c++20 *.cpp $(pkg-config --cflags --libs korvelscript)
#include <csignal>
#include <cstdio>
#include <cstring>

#include "MediaHost.h"
#include "UIThread.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"

using namespace Korvel;

static constexpr char kUsage[] =
    "Usage: mediahost [--debug]\n"
    "Prints the port at which scripts reach it, and runs until SIGINT or SIGTERM.\n"
    "  --debug  with the members that are for debugging\n"
    "KORVEL_ListenAddress in the environment is the address to listen at, any by default;\n"
    "127.0.0.1 keeps other machines out.\n";

static UIThread* s_UIThread;

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
    static bool s_IsDebug = false;
    if (argc > 1) {
        bool wantsHelp = strcmp(argv[1], "--help") == 0;
        s_IsDebug = argc == 2 && strcmp(argv[1], "--debug") == 0;
        if (!s_IsDebug) {
            fputs(kUsage, wantsHelp ? stdout : stderr);
            return wantsHelp ? 0 : 2;
        }
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
    if (!StartScripting(ScriptVal()) || !GetListenPort()) {
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
