// Records, symbols and calls.
//
// A record's members are on a list that look-ups walk without a lock while others change it, so a
// symbol is complete before a release store puts it there, and one that leaves keeps its own link:
// a reader that stands on it goes on where it was going. When a class's parent becomes known its
// constants move to the root's list. A reader on the class's list must not wander off into the
// root's, so a constant has a second link for that, and SymbolRange takes the one that belongs to
// the list that it walks. The parent is stored first, then each constant enters the root's list
// before it leaves its own: whoever misses it there finds the parent, and the constant at the root.
#include "objects/ScriptSymbol.h"

#include <algorithm>
#include <cstring>
#include <utility>

#include "Platform/Time.h"
#include "core/ScriptHooksInternal.h"
#include "core/SpinLock.h"
#include "core/TagList.h"
#include "core/TextProbeInternal.h"
#include "objects/LiveSymbolsInternal.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptHelpInternal.h"

namespace Korvel {

const char* const SSTName[SST_EndOpcode - SST_FirstOpcode] = {
    "SST_Create",
    "SST_Call",
    "SST_GetTable",
    "SST_SetTable",
    "SST_Add",
    "SST_Sub",
    "SST_Mul",
    "SST_Div",
    "SST_Pow",
    "SST_Unm",
    "SST_EQ",
    "SST_LE",
    "SST_LT",
    "SST_Concat",
    "SST_ToString",
    "SST_CallFunction",
    "SST_CallMemberFunction",
    "SST_GetSetAttrs",
    "SST_GetCustomData",
    "SST_SetCustomData",
    "SST_GetObject",
    "SST_OnConnect",
    "SST_OnConnectFailed",
    "SST_OnDisconnect",
    "SST_IsDebug",
    "SST_GetTableUnknown",
};

constinit std::atomic<ScriptInfo*> g_ScriptInfoList{nullptr};
constinit TagList* g_CurHelp = nullptr;
constinit NestedSpinLock g_SSILock;

// The steps that need the private parts of records and symbols. All are for holders of the lock.
struct ScriptInfoAccess {
    using SymbolLink = std::atomic<ScriptSymbol*>;

    static void Push(SymbolLink& head, SymbolLink& next, ScriptSymbol& symbol) {
        next.store(head.load(std::memory_order_relaxed), std::memory_order_relaxed);
        head.store(&symbol, std::memory_order_release);
    }

    // The link on which a list goes on behind a symbol.
    static SymbolLink& Next(const ScriptInfo& list, ScriptSymbol& symbol) {
        return symbol.m_Info == &list ? symbol.m_Next : symbol.m_RootNext;
    }

    static bool Unlink(ScriptInfo& list, const ScriptSymbol& symbol) {
        SymbolLink* link = &list.m_Symbols;
        while (ScriptSymbol* here = link->load(std::memory_order_relaxed)) {
            SymbolLink& next = Next(list, *here);
            if (here == &symbol) {
                link->store(next.load(std::memory_order_relaxed), std::memory_order_release);
                return true;
            }
            link = &next;
        }
        return false;
    }

    static void MoveToRoot(ScriptSymbol& constant) {
        Push(GetRootScriptInfo().m_Symbols, constant.m_RootNext, constant);
    }

    // To the front of the root's list, the newest first there, too.
    static void MoveConstants(ScriptInfo& info) {
        SymbolLink* link = &info.m_Symbols;
        SymbolLink* place = &GetRootScriptInfo().m_Symbols;
        while (ScriptSymbol* symbol = link->load(std::memory_order_relaxed)) {
            if (symbol->GetKind() == SST_Constant) {
                Push(*place, symbol->m_RootNext, *symbol);
                place = &symbol->m_RootNext;
                link->store(symbol->m_Next.load(std::memory_order_relaxed),
                            std::memory_order_release);
            } else {
                link = &symbol->m_Next;
            }
        }
    }

    static void SetParent(ScriptInfo& info, ScriptInfo* parent) {
        if (info.IsParentKnown()) return;
        // A chain that came back to its beginning would never end.
        for (ScriptInfo* above = parent; above; above = above->GetParent()) {
            if (above == &info) parent = nullptr;
        }
        info.m_Parent.store(parent ? parent : &GetRootScriptInfo(), std::memory_order_release);
        MoveConstants(info);
    }
};

namespace {

// A name to look for. The walk compares probes and hardly ever touches texts.
class NameToFind {
public:
    explicit NameToFind(const char* name)
        : m_Name(name), m_Length(name ? strlen(name) : 0), m_Probe(GetTextProbe(name, m_Length)) {}

    uint32_t GetProbe() const { return m_Probe; }

    // Whether a text with the same probe is the same. Its length differs by multiples of 256.
    bool IsText(const char* other) const {
        if (m_Length == 0) return true;  // no other text has that probe
        if (m_Length > 255) return strcmp(m_Name, other) == 0;
        if (other[m_Length] != 0) return false;
        if (m_Length <= 3) return true;  // each byte is in the probe
        if (m_Length < 8)
            return IsSame<uint32_t>(other, 0) && IsSame<uint32_t>(other, m_Length - 4);
        for (size_t i = 0; i + 8 < m_Length; i += 8) {
            if (!IsSame<uint64_t>(other, i)) return false;
        }
        return IsSame<uint64_t>(other, m_Length - 8);
    }

private:
    template <class Word>
    bool IsSame(const char* other, size_t at) const {
        Word a, b;
        memcpy(&a, m_Name + at, sizeof a);
        memcpy(&b, other + at, sizeof b);
        return a == b;
    }

    const char* m_Name;
    size_t m_Length;
    uint32_t m_Probe;
};

const char* OrEmpty(const char* text) {
    return text ? text : "";
}

}  // namespace

void ObtainSSILock() {
    g_SSILock.ObtainLock();
}
void ReleaseSSILock() {
    g_SSILock.ReleaseLock();
}

ScriptInfo::ScriptInfo(unsigned int version, const char* name, const char* shortHelp,
                       const char* longHelp)
    : m_Version(version),
      m_Name(OrEmpty(name)),
      m_ShortHelp(OrEmpty(shortHelp)),
      m_LongHelp(OrEmpty(longHelp)) {
    AutoNestedSpinLock lock(g_SSILock);
    m_Next.store(g_ScriptInfoList.load(std::memory_order_relaxed), std::memory_order_relaxed);
    g_ScriptInfoList.store(this, std::memory_order_release);
}

ScriptInfo::~ScriptInfo() {
    AutoNestedSpinLock lock(g_SSILock);
    std::atomic<ScriptInfo*>* link = &g_ScriptInfoList;
    while (ScriptInfo* info = link->load(std::memory_order_relaxed)) {
        if (info == this) {
            link->store(m_Next.load(std::memory_order_relaxed), std::memory_order_release);
            return;
        }
        link = &info->m_Next;
    }
}

ScriptSymbol* ScriptInfo::FindSymbol(const char* name, unsigned int kind) const {
    kind &= SST_KindMask;
    if (kind >= SST_FirstOpcode) {
        for (const ScriptInfo* info = this; info; info = info->GetParent()) {
            if (ScriptSymbol* symbol = info->GetOpcode(kind)) return symbol;
        }
        return nullptr;
    }
    NameToFind wanted(name);
    for (const ScriptInfo* info = this; info; info = info->GetParent()) {
        for (ScriptSymbol& symbol : info->GetSymbols()) {
            if (symbol.m_NameProbe != wanted.GetProbe()) continue;
            if (symbol.GetKind() != kind && (kind != 0 || !name)) continue;
            if (!wanted.IsText(symbol.m_Name)) continue;
            if (!symbol.IsPresent()) continue;
            return &symbol;
        }
    }
    return nullptr;
}

ScriptSymbol::ScriptSymbol()
    : m_ShortHelp(""), m_LongHelp(""), m_NextCallTime(Platform::GetUpTime()) {}

bool ScriptSymbol::IsPresent() const {
    return !(m_Flags & SSF_Debug) || IsDebugMode();
}

ScriptSymbol::~ScriptSymbol() {
    Leave();
    delete m_Tags;
}

void ScriptSymbol::Init(unsigned int version, const char* name, unsigned int flags,
                        ScriptInfo& info, TagList* help) {
    Leave();
    TagList* tags = new TagList;
    if (tags && help) tags->SetTags(help, true);
    Enter(version, name, flags, info, tags);
}

void ScriptSymbol::Init(unsigned int version, const char* name, unsigned int flags,
                        ScriptInfo& info, std::initializer_list<HelpTag> help) {
    Leave();
    TagList* tags = new TagList;
    for (const HelpTag& tag : help) {
        if (!tags) break;
        if ((tag.m_Tag & TAG_TYPE_MASK) == TAG_STRING) {
            tags->Set(tag.m_Tag, tag.m_Text, true);
        } else {
            tags->Set(tag.m_Tag, tag.m_Bool, true);
        }
    }
    Enter(version, name, flags, info, tags);
}

// Takes the list over. The other fields are set.
void ScriptSymbol::SetHelp(TagList* tags) {
    TagList* old = std::exchange(m_Tags, tags);
    m_AttrName = nullptr;
    m_ShortHelp = "";
    if (TagList* more = std::exchange(g_CurHelp, nullptr); more && tags) tags->SetTags(more, true);
    if (tags) {
        m_AttrName = tags->GetString(SYMT_AttrName, nullptr);
        m_ShortHelp.Set(tags->GetString(SYMT_ShortHelp, ""), true);
    }
    m_LongHelp = ComposeLongHelp(*this);
    delete old;
}

void ScriptSymbol::Enter(unsigned int version, const char* name, unsigned int flags,
                         ScriptInfo& info, TagList* help) {
    m_Version = version;
    m_Name.Set(name, true);
    m_NameProbe = NameToFind(m_Name).GetProbe();
    m_Flags = flags;
    m_Info = &info;
    SetHelp(help);

    m_IsEntered = true;
    LiveSymbols::Add(*this);  // first: who finds it may call it
    AutoNestedSpinLock lock(g_SSILock);
    if (GetKind() >= SST_FirstOpcode) {
        info.m_Opcodes[GetKind() - SST_FirstOpcode].store(this, std::memory_order_release);
    } else if (GetKind() == SST_Constant && info.IsParentKnown() && &info != &GetRootScriptInfo()) {
        ScriptInfoAccess::MoveToRoot(*this);
    } else {
        ScriptInfoAccess::Push(info.m_Symbols, m_Next, *this);
    }
}

// Leaves the fields alone, which a call under way may read.
void ScriptSymbol::Leave() {
    if (!std::exchange(m_IsEntered, false)) return;
    {
        AutoNestedSpinLock lock(g_SSILock);
        if (GetKind() >= SST_FirstOpcode) {
            ScriptSymbol* self = this;
            m_Info->m_Opcodes[GetKind() - SST_FirstOpcode].compare_exchange_strong(self, nullptr);
        } else if (!ScriptInfoAccess::Unlink(*m_Info, *this)) {
            ScriptInfoAccess::Unlink(GetRootScriptInfo(), *this);
        }
    }
    LiveSymbols::Remove(*this);
}

bool ScriptSymbol::Withdraw() {
    Leave();
    return m_Holds.load(std::memory_order_acquire) == 0;
}

namespace {

constexpr unsigned long long kPaceMs = 500;  // between replies of a paced member

// False when the caller has to run the member itself.
bool RunOnGUIThread(ScriptConfig::UIFunction function, void* call) {
    if (IsGUIThread()) return false;
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (config && config->UIExecute) {
        g_ScriptHooks.m_SetWaitingForUI(true);
        config->UIExecute(function, call, nullptr, true);
        g_ScriptHooks.m_SetWaitingForUI(false);
        return true;
    }
    static constinit std::atomic<bool> s_IsTold{false};
    if (!s_IsTold.exchange(true)) {
        g_ScriptHooks.m_Log(
            "g_NoGUI is false, but there is no UIExecute: members run on their callers' threads");
    }
    return false;
}

}  // namespace

struct ScriptSymbol::CallArgs {
    ScriptObject* m_Object;
    ScriptArgs* m_Args;
    ScriptSymbol* m_Symbol;
    bool m_Set;
};

// Call's half on the UI thread.
unsigned long long ScriptSymbol::DoCall(void* callArgs, void*) {
    const CallArgs& call = *static_cast<const CallArgs*>(callArgs);
    call.m_Symbol->Run(call.m_Object, *call.m_Args, call.m_Set);
    return 0;
}

// How long the reply has to wait for the earlier ones, as of now.
unsigned long long ScriptSymbol::TakeTurn() {
    unsigned long long now = Platform::GetUpTime();
    unsigned long long next = m_NextCallTime.load(std::memory_order_relaxed);
    m_NextCallTime.exchange(std::max(next, now) + kPaceMs, std::memory_order_relaxed);
    return next > now ? std::min(next - now, kPaceMs) : 0;
}

void ScriptSymbol::Run(ScriptObject* object, ScriptArgs& args, bool set) {
    DoCall(object, args, set);
    if (!(args.m_Flags & (SVF_CallDelay | SVF_ForceDelay))) [[likely]]
        return;

    unsigned long long delayMs = 0;
    if (args.m_Flags & SVF_CallDelay) delayMs = TakeTurn();
    if (args.m_Flags & SVF_ForceDelay) delayMs = kPaceMs;
    args.m_Flags &= ~(SVF_CallDelay | SVF_ForceDelay);
    if (delayMs) args["__delay"] = static_cast<int>(delayMs);
}

void ScriptSymbol::Call(ScriptObject* object, ScriptArgs& args, bool set) {
    if (m_Flags & (set ? SSF_DelaySet : SSF_DelayGet)) args.m_Flags |= SVF_CallDelay;
    if (!(m_Flags & SSF_AnyThread) && !g_NoGUI.load(std::memory_order_relaxed)) {
        CallArgs call{object, &args, this, set};
        if (RunOnGUIThread(DoCall, &call)) return;
    }
    Run(object, args, set);
}

void _SetScriptInfo(ScriptObject* object, ScriptInfo& info) {
    if (!info.IsParentKnown()) _InitScriptInfo(info, object->GetScriptInfo());
    object->SetScriptInfo(&info);
}

void _InitScriptInfo(ScriptInfo& info, ScriptInfo* parent) {
    if (info.IsParentKnown()) return;
    AutoNestedSpinLock lock(g_SSILock);
    ScriptInfoAccess::SetParent(info, parent);
}

}  // namespace Korvel
