#pragma once

#include <cstdint>

namespace Korvel {

class ScriptObject;
class ScriptSymbol;

// The symbols that stand on a record, by their addresses.
//
// A function value is such an address. Scripts and peers hand it back, and they may have kept it
// for too long or made it up, so it is looked up here before anything is done with it.
//
// Threads: any. The lock is taken alone, and held for a look-up, or while all symbols move to a
//          larger table.
class LiveSymbols {
public:
    static void Add(ScriptSymbol& symbol);
    static void Remove(ScriptSymbol& symbol);  // does nothing when it is not there

    // The symbol at an address, with one hold more, which the caller gives back. Null when there is
    // none.
    static ScriptSymbol* Hold(uint64_t address);
};

// The symbol that a function value means, held for a call on `object`; null when it must not be
// called there. A function is called on objects of its class, and in debug mode alone if it is for
// that. An SST_Create is called on any object, so it leaves the object alone. Nothing else is
// called this way: SST_CallFunction itself would never come to an end.
class HeldSymbol {
public:
    HeldSymbol(uint64_t function, const ScriptObject& object);
    HeldSymbol(const HeldSymbol&) = delete;
    HeldSymbol& operator=(const HeldSymbol&) = delete;
    ~HeldSymbol();

    explicit operator bool() const { return m_Symbol != nullptr; }
    ScriptSymbol* operator->() const { return m_Symbol; }

private:
    ScriptSymbol* m_Symbol;
};

}  // namespace Korvel
