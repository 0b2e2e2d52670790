// Answers to datagrams. Whoever asks may be anybody, and what hosts tell of themselves may be
// anything.
#include <algorithm>
#include <cstring>
#include <utility>
#include <vector>

#include "Platform/NetworkingInternal.h"
#include "Platform/Processes.h"
#include "remote/ServerDiscoveryInternal.h"

namespace Korvel {
namespace {

constexpr int kMostText = static_cast<int>(kMaxDatagram - kMagicSize - 1);  // the NUL
constexpr int kHostNameSize = 100;

// A table that grows as long as its text fits into so many bytes.
class BoundedTable {
public:
    BoundedTable(int level, int maxBytes) : m_Level(level), m_Left(maxBytes - Length(m_Table)) {}

    // False, with nothing done, when there is no room. The key must not be there yet.
    bool Add(const ScriptVal& key, const ScriptVal& value) {
        if (!TakeRoom(key, value)) return false;
        m_Table[key] = value;
        return true;
    }
    // The next item of a list, whose text has no key.
    bool AddItem(const ScriptVal& value) {
        if (!TakeRoom(1, value)) return false;
        m_Table[++m_NumItems] = value;
        return true;
    }

    int GetLeft() const { return m_Left; }
    const ScriptVal& Get() const { return m_Table; }

private:
    int Length(const ScriptVal& table) const { return table.ToTextLen(m_Level, 0); }

    bool TakeRoom(const ScriptVal& key, const ScriptVal& value) {
        ScriptVal one(SV_Table, nullptr);
        one[key] = value;
        int length = Length(one) - Length(ScriptVal(SV_Table, nullptr)) + 1;  // and a comma
        if (length <= 0 || length > m_Left) return false;
        m_Left -= length;
        return true;
    }

    const int m_Level;  // at which the table stands
    ScriptVal m_Table{SV_Table, nullptr};
    int m_Left;
    int m_NumItems = 0;
};

// Entries in their order, as many as fit. False when there are more.
bool AddEntries(BoundedTable& table, const ScriptVal& from, const ScriptVal& butKeysOf) {
    bool isWhole = true;
    for (TableEntry* entry = nullptr; from.NextKey(entry);) {
        if (butKeysOf.Exists(entry->m_Key)) continue;
        isWhole &= table.Add(entry->m_Key, entry->m_Value);
    }
    return isWhole;
}

bool AddNames(BoundedTable& table, const HostRegistry& registry) {
    std::vector<std::string> names;
    bool isWhole = registry.ListNames(static_cast<size_t>(std::max(table.GetLeft(), 0)), names);
    for (const std::string& name : names) isWhole &= table.AddItem(name.c_str());
    return isWhole;
}

void Append(ScriptVal& table, const ScriptVal& more) {
    for (TableEntry* entry = nullptr; more.NextKey(entry);) table[entry->m_Key] = entry->m_Value;
}

// The room that an entry with an empty table takes.
int RoomForList(const char* key) {
    ScriptVal empty(SV_Table, nullptr), one(SV_Table, nullptr);
    one[key] = empty;
    return one.ToTextLen(0, 0) - empty.ToTextLen(0, 0) + 1;
}

}  // namespace

ScriptVal DescribeMachine() {
    ScriptVal machine(SV_Table, nullptr);
    machine["Version"] = "18.0";
    char hostName[kHostNameSize] = "";
    if (Platform::GetHostName(hostName, kHostNameSize - 1)) machine["HostName"] = hostName;
    OxStringT<char> user;
    if (Platform::GetEnv("USER", user)) machine["UserName"] = static_cast<const char*>(user);
    machine["Platform"] = "Linux";
    return machine;
}

std::string AnswerDatagram(const HostRegistry& registry, std::string_view datagram,
                           const ScriptVal& machine) {
    if (!datagram.starts_with(kQuestionMagic)) return {};
    std::string name(datagram.substr(kMagicSize));
    name.resize(strlen(name.c_str()));
    ScriptVal pingInfo;
    if (!name.empty() && !registry.GetPingInfo(name.c_str(), pingInfo)) return {};

    // What is always there goes in first, and the rest gets what room there is. In the text it
    // stands last.
    BoundedTable fixed(0, kMostText - (name.empty() ? RoomForList("Hosts") : 0));
    ScriptVal marked(SV_Table, nullptr);
    marked["Truncated"] = true;
    AddEntries(fixed, marked, {});  // keeps its place
    ScriptVal known(machine);
    if (!name.empty()) known["Type"] = name.c_str();
    bool isWhole = AddEntries(fixed, known, {});

    ScriptVal answer(SV_Table, nullptr);
    if (name.empty()) {
        BoundedTable names(1, fixed.GetLeft() + ScriptVal(SV_Table, nullptr).ToTextLen(1, 0));
        isWhole &= AddNames(names, registry);
        answer["Hosts"] = names.Get();
    } else {
        BoundedTable told(0, fixed.GetLeft() + ScriptVal(SV_Table, nullptr).ToTextLen(0, 0));
        isWhole &= AddEntries(told, pingInfo, fixed.Get());
        answer = told.Get();
    }
    Append(answer, fixed.Get());
    if (isWhole) answer["Truncated"] = SV_Nil;

    OxStringT<char> text;
    if (!answer.ToText(text, 0, 0) || strlen(text) > kMostText) return {};
    return std::string(kAnswerMagic).append(text).append(1, '\0');
}

bool AnswerLimiter::Allow(unsigned int ip, int64_t nowMs) {
    if (Platform::IsLoopback(ip)) return true;
    if (m_Answers.size() >= kMostAddresses && !m_Answers.contains(ip)) {
        std::erase_if(m_Answers, [=](const auto& known) {
            return nowMs - known.second.m_LastMs >= kWindowMs;
        });
        if (m_Answers.size() >= kMostAddresses) return false;
    }
    Answers& answers = m_Answers[ip];
    int64_t& oldest = answers.m_TimesMs[static_cast<size_t>(answers.m_Next)];
    if (answers.m_Count == kMostAnswers && nowMs - oldest < kWindowMs) return false;
    oldest = answers.m_LastMs = nowMs;
    answers.m_Next = (answers.m_Next + 1) % kMostAnswers;
    answers.m_Count = std::min(answers.m_Count + 1, kMostAnswers);
    return true;
}

}  // namespace Korvel
