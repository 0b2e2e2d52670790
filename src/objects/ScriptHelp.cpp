#include <algorithm>
#include <cstring>
#include <string_view>
#include <utility>

#include "core/0ReusePool.h"
#include "core/TagList.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptHelpInternal.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {
namespace {

// A block of the pools, until the end of its scope.
template <class T>
class Block {
public:
    Block() = default;
    explicit Block(size_t count)
        : m_Items(static_cast<T*>(ReusePoolManager::Get().Alloc(count * sizeof(T)))) {}
    Block(const Block&) = delete;
    Block& operator=(const Block&) = delete;
    ~Block() { ReusePoolManager::Get().Free(m_Items); }
    void Swap(Block& other) { std::swap(m_Items, other.m_Items); }

    T* m_Items = nullptr;  // also without memory
};

// A text that grows at its end.
class HelpText {
public:
    template <class... Texts>
    void Add(const Texts&... texts) {
        (Append(texts), ...);
    }
    void AddBlanks(size_t count) {
        while (count--) Append(" ");
    }

    std::string_view View() const { return {m_Block.m_Items, m_Length}; }

    ScriptVal ToValue() const {
        if (m_IsLost) return {};
        return ScriptVal(m_Length ? m_Block.m_Items : "", static_cast<int>(m_Length));
    }
    OxID ToID() const { return m_Length && !m_IsLost ? OxID(m_Block.m_Items, m_Length) : ""; }

private:
    void Append(std::string_view text) {
        if (text.empty()) return;
        size_t length = m_Length + text.size();
        if (length > m_Size && !Grow(length)) return;
        memcpy(m_Block.m_Items + m_Length, text.data(), text.size());
        m_Length = length;
    }

    bool Grow(size_t length) {
        size_t size = std::max<size_t>(2 * length, 256);
        Block<char> grown(size);
        if (!grown.m_Items || length > kMaxStringLength) {
            m_IsLost = true;
            return false;
        }
        if (m_Length) memcpy(grown.m_Items, m_Block.m_Items, m_Length);
        m_Block.Swap(grown);
        m_Size = size;
        return true;
    }

    Block<char> m_Block;
    size_t m_Size = 0;
    size_t m_Length = 0;
    bool m_IsLost = false;  // a part is missing
};

std::string_view OrEmpty(const char* text) {
    return text ? text : "";
}

// The line of a usage, from the tags behind the one that opens it.
void AddUsageLine(HelpText& text, const ScriptSymbol& symbol, HelpTags tags) {
    bool isFunction = symbol.GetKind() == SST_Function;
    bool isVariable = symbol.GetKind() == SST_Variable;
    std::string_view className = symbol.GetInfo()->GetName();
    std::string_view name = OrEmpty(symbol.GetName());
    const char* type = nullptr;
    const char* argName = nullptr;
    if (tags.Take(SYMT_ReturnType, type)) tags.Take(SYMT_ReturnName, argName);
    if (isFunction) {
        if (type) text.Add(type, " ");
        text.Add(className, ":", name, "(");
    } else if (isVariable && type) {
        text.Add(type, " = ", className, ".", name);
    }

    bool isOptional = false;
    int numArgs = 0, numBrackets = 0;
    for (;;) {
        if (tags.Take(SYMT_Optional, isOptional)) continue;
        bool isArg = (isFunction || isVariable) && tags.Take(SYMT_ArgType, type);
        if (!isArg) break;
        if (isVariable) {
            text.Add(className, ".", name, " = ", OrEmpty(type));
            continue;
        }
        if (isOptional) {
            text.Add(" [");
            numBrackets++;
        }
        if (numArgs++) text.Add(", ");
        text.Add(OrEmpty(type));
        if (tags.Take(SYMT_ArgName, argName)) text.Add(" ", OrEmpty(argName));
    }
    while (numBrackets--) text.Add("]");
    if (isFunction) text.Add(")");
    if (isFunction || isVariable) text.Add("\n");
}

// Puts the first dashes of all lines into one column.
void Align(const HelpText& text, HelpText& aligned) {
    size_t width = 0;
    auto forLines = [&text](auto visit) {
        std::string_view rest = text.View();
        for (size_t end; (end = rest.find('\n')) != rest.npos; rest.remove_prefix(end + 1)) {
            visit(rest.substr(0, end));
        }
    };
    forLines([&](std::string_view line) {
        width = std::max(width, std::min(line.find('-'), line.size()));
    });
    forLines([&](std::string_view line) {
        size_t dash = line.find('-');
        if (dash != line.npos) {
            aligned.Add(line.substr(0, dash));
            aligned.AddBlanks(width - dash + 1);
            line.remove_prefix(dash);
        }
        aligned.Add(line, "\n");
    });
}

void AddShortHelp(HelpText& text, std::string_view shortHelp) {
    if (!shortHelp.empty()) text.Add(" - ", shortHelp);
}

const char* GetSuffix(const ScriptSymbol& symbol) {
    bool canRead = (symbol.GetFlags() & SSF_Read) != 0;
    bool canWrite = (symbol.GetFlags() & SSF_Write) != 0;
    if (symbol.GetKind() == SST_Function) return "()";
    if (symbol.GetKind() != SST_Variable || !(canRead || canWrite)) return "";
    return canRead && canWrite ? " [RW]" : canRead ? " [R]" : " [W]";
}

// What a member looks like: Class:Name(), Class.Name [RW] or Class/Name, and its short help.
void AddMember(HelpText& text, const ScriptInfo& info, const ScriptSymbol& symbol) {
    static const char* const marks[] = {"", ":", ".", "", "/"};
    uint32_t kind = symbol.GetKind();
    text.Add(info.GetName(), kind <= SST_Help ? marks[kind] : "", OrEmpty(symbol.GetName()),
             GetSuffix(symbol));
    AddShortHelp(text, OrEmpty(symbol.GetShortHelp()));
}

size_t CountInHelp(const ScriptInfo& info) {
    SymbolRange symbols = info.GetSymbols();
    return static_cast<size_t>(std::count_if(symbols.begin(), symbols.end(), IsInHelp));
}

// The members of one class, sorted by name. False when there are none.
bool AddMembers(HelpText& text, const ScriptInfo& info) {
    size_t most = CountInHelp(info);  // more may come meanwhile: they are left out
    Block<const ScriptSymbol*> block(most + 1);
    if (!block.m_Items) return false;
    const ScriptSymbol** end = block.m_Items;
    for (const ScriptSymbol& symbol : info.GetSymbols()) {
        if (end < block.m_Items + most && IsInHelp(symbol)) *end++ = &symbol;
    }
    std::stable_sort(block.m_Items, end, [](const ScriptSymbol* a, const ScriptSymbol* b) {
        return strcmp(a->GetName(), b->GetName()) < 0;
    });
    for (const ScriptSymbol** symbol = block.m_Items; symbol != end; symbol++) {
        text.Add("  ");
        AddMember(text, info, **symbol);
        text.Add("\n");
    }
    return end != block.m_Items;
}

bool HasWholeChain(const ScriptInfo* info) {
    while (info && info->IsParentKnown()) info = info->GetParent();
    return info == nullptr;
}

ScriptVal GetClassListText() {
    HelpText text, aligned;
    text.Add("\nClasses:\n");
    for (const ScriptInfo* info = g_ScriptInfoList; info; info = info->GetNext()) {
        SymbolRange symbols = info->GetSymbols();
        if (!*info->GetName() || symbols.begin() == symbols.end()) continue;
        text.Add("  ", info->GetName());
        AddShortHelp(text, info->GetShortHelp());
        text.Add("\n");
    }
    Align(text, aligned);
    return aligned.ToValue();
}

ScriptVal GetMemberListText(const ScriptInfo& info) {
    HelpText text, aligned;
    text.Add(info.GetName(), " Members:\n");
    bool hasAny = false;
    for (const ScriptInfo* level = &info; level; level = level->GetParent()) {
        hasAny |= AddMembers(text, *level);
    }
    if (!hasAny) return {};
    Align(text, aligned);
    return aligned.ToValue();
}

ScriptVal GetMemberText(const ScriptInfo& info, std::string_view member) {
    for (const ScriptInfo* level = &info; level; level = level->GetParent()) {
        for (const ScriptSymbol& symbol : level->GetSymbols()) {
            if (!IsInHelp(symbol) || OrEmpty(symbol.GetName()) != member) continue;
            HelpText text;
            AddMember(text, *level, symbol);
            text.Add("\n\n", OrEmpty(symbol.GetLongHelp()));
            return text.ToValue();
        }
    }
    return {};
}

}  // namespace

HelpTags::HelpTags(const TagList& tags) : m_Tags(tags), m_Item(tags.First()) {}

const char* HelpTags::GetText() const {
    return TagList::GetString(m_Item);
}
void HelpTags::Step() {
    m_Item = m_Tags.Next(m_Item);
}

bool HelpTags::Take(unsigned long long tag, const char*& text) {
    if (!Is(tag)) return false;
    text = GetText();
    Step();
    return true;
}

bool HelpTags::Take(unsigned long long tag, bool& value) {
    if (!Is(tag)) return false;
    value = TagList::GetBool(m_Item);
    Step();
    return true;
}

bool IsInHelp(const ScriptSymbol& symbol) {
    uint32_t kind = symbol.GetKind();
    if (kind >= SST_FirstOpcode || kind == SST_Constant || symbol.GetName().IsEmpty()) return false;
    return !(symbol.GetFlags() & (SSF_Hidden | SSF_Debug)) || IsDebugMode();
}

OxID ComposeLongHelp(const ScriptSymbol& symbol) {
    const TagList* list = symbol.GetHelpTags();
    if (!list) return "";
    HelpText text;
    for (HelpTags tags(*list); tags;) {
        const char* usage;
        if (!tags.Take(SYMT_Usage, usage)) {
            tags.Step();
            continue;
        }
        AddUsageLine(text, symbol, tags);
        if (usage) text.Add("  ", usage, "\n\n");
    }
    for (HelpTags tags(*list); tags; tags.Step()) {
        bool isText = tags.Is(SYMT_Body) || tags.Is(SYMT_Code);
        if (isText && tags.GetText()) text.Add(tags.GetText(), "\n\n");
    }
    return text.ToID();
}

ScriptVal GetHelpText(const char* topic) {
    std::string_view whole = OrEmpty(topic);
    if (whole.empty()) return GetClassListText();
    size_t end = std::min(whole.find_first_of(".:/"), whole.size());
    std::string_view className = whole.substr(0, end);
    std::string_view member = whole.substr(std::min(end + 1, whole.size()));
    for (const ScriptInfo* info = g_ScriptInfoList; info; info = info->GetNext()) {
        if (info->GetName() != className || !HasWholeChain(info)) continue;
        ScriptVal text = member.empty() ? GetMemberListText(*info) : GetMemberText(*info, member);
        if (!text.IsNil()) return text;
    }
    return {};
}

}  // namespace Korvel
