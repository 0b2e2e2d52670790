// The strings of a machine, each once.
#pragma once

#include "textform/Value.h"

namespace Korvel::TextForm {

// Chains of strings by hash. The hash sets the order in which a table's keys come, so it is fixed:
// all bytes of short strings, some of long ones, from the last to the first.
class StringTable {
public:
    static uint32_t GetHash(const char* bytes, size_t length) {
        auto hash = static_cast<uint32_t>(length);
        size_t step = (length >> 5) + 1;
        for (size_t i = length; i >= step; i -= step) {
            hash ^= (hash << 5) + (hash >> 2) + static_cast<unsigned char>(bytes[i - 1]);
        }
        return hash;
    }

    String* Intern(Machine& machine, const char* bytes, size_t length);

    // Frees the dead strings of one chain and repaints the others.
    void Sweep(Machine& machine, size_t chain);
    void ShrinkIfEmpty(Machine& machine);
    size_t GetChainCount() const { return m_ChainCount; }
    size_t GetCount() const { return m_Count; }

private:
    void Resize(Machine& machine, size_t chainCount);

    Object** m_Chains = nullptr;
    size_t m_ChainCount = 0;
    size_t m_Count = 0;
};

}  // namespace Korvel::TextForm
