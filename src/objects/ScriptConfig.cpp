#include "objects/ScriptConfig.h"

#include "Platform/Threads.h"

namespace Korvel {

constinit std::atomic<ScriptConfig*> g_ScriptConfig{nullptr};
constinit std::atomic<bool> g_NoGUI{true};
constinit std::atomic<unsigned long long> g_GUIThread{0};

namespace {

// Ahead of the static initialisers of hosts, which may come before ours where the library is linked
// as an archive.
struct LoadingThread {
    LoadingThread() { SetGUIThread(Platform::GetCurrentThreadID()); }
};
__attribute__((init_priority(102))) LoadingThread s_LoadingThread;

}  // namespace

unsigned long long GetGUIThread() {
    return g_GUIThread.load(std::memory_order_relaxed);
}

void SetGUIThread(unsigned long long threadID) {
    g_GUIThread.store(threadID, std::memory_order_relaxed);
}

bool IsGUIThread() {
    return Platform::GetCurrentThreadID() == GetGUIThread();
}

bool IsDebugMode() {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    return config && config->IsDebugMode && config->IsDebugMode(config->m_UserData, nullptr);
}

ScriptObject* GetAppObject() {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    return config && config->GetApp ? config->GetApp(config->m_UserData, nullptr) : nullptr;
}

}  // namespace Korvel
