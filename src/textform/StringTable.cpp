#include "textform/StringTable.h"

#include <algorithm>

#include "textform/Machine.h"
#include "textform/Table.h"

namespace Korvel::TextForm {

namespace {

constexpr size_t kMinChains = 128;

String* AsString(Object* object) {
    return static_cast<String*>(object);
}

}  // namespace

void StringTable::Resize(Machine& machine, size_t chainCount) {
    auto** chains = machine.NewArray<Object*>(chainCount);
    std::fill_n(chains, chainCount, nullptr);
    for (size_t i = 0; i < m_ChainCount; i++) {
        while (Object* object = m_Chains[i]) {
            m_Chains[i] = object->m_Next;
            Object*& chain = chains[AsString(object)->m_Hash & (chainCount - 1)];
            object->m_Next = chain;
            chain = object;
        }
    }
    machine.FreeArray(m_Chains, m_ChainCount);
    m_Chains = chains;
    m_ChainCount = chainCount;
}

String* StringTable::Intern(Machine& machine, const char* bytes, size_t length) {
    uint32_t hash = GetHash(bytes, length);
    if (m_ChainCount) {
        size_t steps = 0;
        for (Object* o = m_Chains[hash & (m_ChainCount - 1)]; o; o = o->m_Next, steps++) {
            String* string = AsString(o);
            if (string->m_Hash == hash && string->m_Length == length &&
                (length == 0 || memcmp(string->GetText(), bytes, length) == 0)) {
                machine.Revive(string);
                return string;
            }
        }
        if (machine.m_IsLimited) machine.Spend(steps / 16);  // somebody's choice, if it is long
    }
    // Never in the middle of a sweep over the chains: those behind would be swept twice.
    if (m_Count >= m_ChainCount && machine.m_Phase != Machine::Phase::SweepStrings) {
        Resize(machine, std::max(kMinChains, m_ChainCount * 2));
    }
    auto* string = static_cast<String*>(machine.NewBytes(sizeof(String) + length + 1));
    string->m_Type = Type::String;
    string->m_Marks = machine.m_White;
    string->m_Extra = 0;
    string->m_Hash = hash;
    string->m_Length = length;
    if (length) memcpy(string->GetBytes(), bytes, length);
    string->GetBytes()[length] = 0;
    Object*& chain = m_Chains[hash & (m_ChainCount - 1)];
    string->m_Next = chain;
    chain = string;
    m_Count++;
    return string;
}

void StringTable::Sweep(Machine& machine, size_t chain) {
    Object** link = &m_Chains[chain];
    while (Object* object = *link) {
        if (!machine.IsDead(object)) {
            object->m_Marks = static_cast<uint8_t>(
                (object->m_Marks & ~(Machine::kWhites | Machine::kBlack)) | machine.m_White);
            link = &object->m_Next;
            continue;
        }
        *link = object->m_Next;
        machine.FreeBytes(object, sizeof(String) + AsString(object)->m_Length + 1);
        m_Count--;
    }
}

void StringTable::ShrinkIfEmpty(Machine& machine) {
    if (m_Count < m_ChainCount / 4 && m_ChainCount > kMinChains * 2) {
        try {
            Resize(machine, m_ChainCount / 2);
        } catch (const Raised&) {
            // it was only to save memory
        }
    }
}

String* Machine::NewString(const char* bytes, size_t length) {
    if (length > SIZE_MAX / 4) RaiseMemoryError();
    return m_Strings.Intern(*this, bytes, length);
}

}  // namespace Korvel::TextForm
