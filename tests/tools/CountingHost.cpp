// A host that keeps count of what it has given away. Told to end by SIGTERM, it lets go of what it
// keeps and waits for its scripts; its status tells whether all has come back. It prints its port.
#include <unistd.h>

#include <csignal>
#include <cstdio>

#include "Platform/Time.h"
#include "SharedObject.h"
#include "UIThread.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptPort.h"

namespace Korvel {
namespace {

constexpr int kLimitMs = 60000;

class Item : public Scripted<SharedObject> {
    KORVEL_SCRIPTED(Item)
public:
    explicit Item(double number) : m_Number(number) {
        SetScriptClass();
        s_NumAlive++;
    }
    ~Item() override { s_NumAlive--; }

    static inline std::atomic<int> s_NumAlive{0};

private:
    double m_Number;
};

KORVEL_PUBLISH(Item, "Item", "Has a number.", "")
KORVEL_CREATE(Item, 0) {
    args.ReturnObject(ptr<Item>(new Item(args[1].ToNumber())).Get());
}
KORVEL_VARIABLE(Item, Number, SSF_Read | SSF_Write) {
    if (set) {
        self.m_Number = args[1].ToNumber();
    } else {
        args.ReturnNumber(self.m_Number);
    }
}
KORVEL_PUBLISHED(Item);

class Host : public Scripted<SharedObject> {
    KORVEL_SCRIPTED(Host)
public:
    Host() { SetScriptClass(); }
    void LetGo() { m_Kept = m_Caller = SV_Nil; }

private:
    ScriptVal m_Kept;
    ScriptVal m_Caller;
    bool m_IsDone = false;
};

KORVEL_PUBLISH(Host, "Host", "Counts.", "")
// What a script has left for others.
KORVEL_VARIABLE(Host, Kept, SSF_Read | SSF_Write) {
    if (set) {
        self.m_Kept = args[1];
    } else {
        args.Return(self.m_Kept);
    }
}
KORVEL_VARIABLE(Host, IsDone, SSF_Read | SSF_Write) {
    if (set) {
        self.m_IsDone = args[1].ToBoolean();
    } else {
        args.ReturnBoolean(self.m_IsDone);
    }
}
// Keeps the application object of the script's process.
KORVEL_FUNCTION(Host, MeetCaller, 0) {
    self.m_Caller = args.GetApp()->FindRemoteObject(1);
}
KORVEL_VARIABLE(Host, Caller, SSF_Read) {
    args.Return(self.m_Caller);
}
KORVEL_VARIABLE(Host, HasCaller, SSF_Read) {
    args.ReturnBoolean(self.m_Caller.IsRemoteObject());
}
// Whether an argument is the host's own object, and no proxy.
KORVEL_FUNCTION(Host, IsHome, 0) {
    args.ReturnBoolean(args[1].Type() == SV_LocalObject);
}
KORVEL_VARIABLE(Host, NumItems, SSF_Read) {
    args.ReturnNumber(Item::s_NumAlive);
}
KORVEL_FUNCTION(Host, Kill, 0) {
    kill(static_cast<pid_t>(args[1].ToInteger()), SIGKILL);
}
KORVEL_PUBLISHED(Host);

UIThread* s_UIThread;

// What the host has got back when nobody holds anything of it.
bool HasAll(Host& host, bool tells) {
    int numApps = 0;
    ForEachApp([](void* count, RemoteApp&) { ++*static_cast<int*>(count); }, &numApps);
    ScriptVal uses(SV_Table, nullptr);
    host.GetObjectInfo("UseCount", uses);
    int numUses = static_cast<int>(uses["UseCount"].ToNumber());
    int numItems = Item::s_NumAlive;
    unsigned int numConnections = GetNumConnections();
    bool hasAll = numApps == 0 && numConnections == 0 && numItems == 0 && numUses == 1;
    if (!hasAll && tells) {
        fprintf(stderr, "left: %u connections, %d held, %d items, %d uses of the host\n",
                numConnections, numApps, numItems, numUses);
    }
    return hasAll;
}

int Run() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    UIThread thread;
    s_UIThread = &thread;
    ptr<Host> host(new Host);

    static ScriptConfig s_Config;
    s_Config.m_Flags = SCF_Host | SCF_Standard;
    s_Config.m_AppName = "CountingHost";
    s_Config.m_UserData = host.Get();
    s_Config.GetApp = [](void* app, TagList*) -> ScriptObject* { return static_cast<Host*>(app); };
    s_Config.UIExecute = [](ScriptConfig::UIFunction function, void* a, void* b, bool wait) {
        return s_UIThread->Execute(function, a, b, wait);
    };
    g_NoGUI = false;
    _InitScripting(s_Config);
    if (!StartScripting(ScriptVal())) return 1;
    printf("%u\n", GetListenPort());
    fflush(stdout);

    int signal;
    sigwait(&signals, &signal);
    auto letGo = [](void* app, void*) -> unsigned long long {
        static_cast<Host*>(app)->LetGo();
        return 0;
    };
    thread.Execute(letGo, host.Get(), nullptr, true);
    StopScripting();  // the script server has the host's object, too
    for (int ms = 0; ms < kLimitMs && !HasAll(*host.Get(), false); ms++) Platform::Wait(1);
    bool hasAll = HasAll(*host.Get(), true);
    CleanupScripting();
    return hasAll ? 0 : 1;
}

}  // namespace
}  // namespace Korvel

int main() {
    return Korvel::Run();
}
