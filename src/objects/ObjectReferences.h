#pragma once

#include <cstdint>

#include "core/Export.h"

namespace Korvel {

class ScriptObject;

// Reference numbers, which tell a living object from another one that was built at its address
// later: a number is never used twice, and an object keeps its own until it is destroyed. The
// operations are used under the name of RemoteApp, which derives from this class.
//
// Threads: any. The lock is held for a look-up, and when the tables double while all entries move;
//          never while another lock is taken.
class KORVEL_EXPORT ObjectReferences {
public:
    // The object's number, made if need be. 0 for null, and when memory has run out.
    static uint64_t AddObjectReference(const ScriptObject* object);

    // The number, or 0 for what has none: any pointer may be asked about, dead ones as well.
    static uint64_t GetObjectReference(const ScriptObject* object);

    // The object with this number; null when there is none.
    static ScriptObject* GetReferenceObject(unsigned long long ref);

    // Forgets the object's number, and takes it out of the tables of exported objects; the result
    // tells whether it stood there. With `dropCounts` the counts held there are given back.
    static bool ClearObjectReferences(ScriptObject* object, bool dropCounts);
};

}  // namespace Korvel
