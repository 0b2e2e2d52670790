#pragma once

#include "Platform/Lock.h"

namespace Korvel::KorvelScript {

struct DebugHookData;  // whatever a language gives its hook

// What a script state asks of its debugger. The object is the lock that guards its data.
//
// Ownership: a language makes it for one state (ScriptLanguage::_NewDebug), and the state deletes
//            it.
// Threads:   all but CleanUp and the destructor are called on the state's thread.
class KORVEL_EXPORT ScriptDebug : public Lock {
public:
    virtual void EnableDebug(bool /*enable*/) {}
    virtual void DebugHook(DebugHookData* /*data*/) {}
    virtual void DoStart() {}  // a run is about to begin; may wait for the debugger's client
    virtual void DoStop() {}   // a run has ended; may wait, too
    virtual void CleanUp() {}  // the state is going away; nothing runs in it any more
};

}  // namespace Korvel::KorvelScript
