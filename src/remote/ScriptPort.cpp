#include "remote/ScriptPort.h"

#include "Platform/Threads.h"
#include "core/ScriptVal.h"
#include "objects/ScriptConfig.h"

namespace Korvel {

void _InitScripting(ScriptConfig& config, TagList*) {
    ScriptConfig* none = nullptr;
    g_ScriptConfig.compare_exchange_strong(none, &config);
    GetAppUUID();
}

void InitScripting(ScriptConfig& config, TagList* tags) {
    if (g_ScriptConfig) return;
    SetGUIThread(Platform::GetCurrentThreadID());
    _InitScripting(config, tags);
}

const ScriptVal& GetAppUUID() {
    static const ScriptVal& uuid = *new ScriptVal(ScriptVal::CreateUUID());
    return uuid;
}

}  // namespace Korvel
