// A hash table whose chains run through the symbols themselves, so that a symbol is registered even
// where memory has run out: the chains only grow longer then. It is constant-initialised and never
// destroyed, since symbols of hosts come before the library's own static objects and go after them.
#include <cstring>
#include <utility>

#include "core/0ReusePool.h"
#include "core/SpinLockInternal.h"
#include "objects/LiveSymbolsInternal.h"
#include "objects/ScriptSymbol.h"

namespace Korvel {

struct LiveSymbolsAccess {
    static ScriptSymbol*& Next(ScriptSymbol& symbol) { return symbol.m_NextLive; }
    static std::atomic<uint32_t>& Holds(ScriptSymbol& symbol) { return symbol.m_Holds; }
};

namespace {

using Access = LiveSymbolsAccess;

constexpr size_t kFirstSize = 256;  // chains; always a power of two

constinit ScriptSymbol* s_FirstChains[kFirstSize] = {};

constinit SpinLock s_LiveLock;

// Guarded by s_LiveLock
constinit ScriptSymbol** s_Chains = s_FirstChains;
constinit size_t s_Size = kFirstSize;
constinit size_t s_Count = 0;

ScriptSymbol*& ChainOf(uint64_t address) {
    uint64_t hash = (address >> 4) * 0x9E3779B97F4A7C15u;
    return s_Chains[(hash >> 32) & (s_Size - 1)];
}

// The link that points at the symbol with this address, or the null one that ends its chain.
ScriptSymbol*& FindLinkLocked(uint64_t address) {
    ScriptSymbol** link = &ChainOf(address);
    while (*link && reinterpret_cast<uint64_t>(*link) != address) link = &Access::Next(**link);
    return *link;
}

void LinkLocked(ScriptSymbol& symbol) {
    ScriptSymbol*& chain = ChainOf(reinterpret_cast<uint64_t>(&symbol));
    Access::Next(symbol) = std::exchange(chain, &symbol);
}

// Moves all symbols to the new chains, and returns the old ones.
ScriptSymbol** RehashLocked(ScriptSymbol** chains, size_t size) {
    ScriptSymbol** old = std::exchange(s_Chains, chains);
    ScriptSymbol** oldEnd = old + std::exchange(s_Size, size);
    for (ScriptSymbol** chain = old; chain != oldEnd; chain++) {
        while (ScriptSymbol* symbol = *chain) {
            *chain = Access::Next(*symbol);
            LinkLocked(*symbol);
        }
    }
    return old;
}

void Grow(size_t size) {
    size_t bytes = size * sizeof(ScriptSymbol*);
    auto chains = static_cast<ScriptSymbol**>(ReusePoolManager::Get().Alloc(bytes));
    if (!chains) return;
    memset(chains, 0, bytes);
    {
        AutoPlacedLock lock(LockRank::Last, s_LiveLock);
        // Another thread may have been first: then the new block is the one that goes.
        if (s_Size < size) chains = RehashLocked(chains, size);
    }
    if (chains != s_FirstChains) ReusePoolManager::Get().Free(chains);
}

bool MayCall(const ScriptSymbol& symbol, const ScriptObject& object) {
    if (!symbol.IsPresent()) return false;
    if (symbol.GetKind() == SST_Create) return true;
    if (symbol.GetKind() != SST_Function) return false;
    const ScriptInfo* info = object.GetScriptInfo();
    while (info && info != symbol.GetInfo()) info = info->GetParent();
    return info != nullptr;
}

void Release(ScriptSymbol& symbol) {
    Access::Holds(symbol).fetch_sub(1, std::memory_order_release);
}

}  // namespace

void LiveSymbols::Add(ScriptSymbol& symbol) {
    size_t grownSize = 0;
    {
        AutoPlacedLock lock(LockRank::Last, s_LiveLock);
        LinkLocked(symbol);
        if (++s_Count > s_Size) grownSize = 2 * s_Size;
    }
    if (grownSize) Grow(grownSize);
}

void LiveSymbols::Remove(ScriptSymbol& symbol) {
    AutoPlacedLock lock(LockRank::Last, s_LiveLock);
    ScriptSymbol*& link = FindLinkLocked(reinterpret_cast<uint64_t>(&symbol));
    if (!link) return;
    link = Access::Next(symbol);
    s_Count--;
}

ScriptSymbol* LiveSymbols::Hold(uint64_t address) {
    AutoPlacedLock lock(LockRank::Last, s_LiveLock);
    ScriptSymbol* symbol = FindLinkLocked(address);
    if (symbol) Access::Holds(*symbol).fetch_add(1, std::memory_order_relaxed);
    return symbol;
}

HeldSymbol::HeldSymbol(uint64_t function, const ScriptObject& object)
    : m_Symbol(LiveSymbols::Hold(function)) {
    if (m_Symbol && !MayCall(*m_Symbol, object)) Release(*std::exchange(m_Symbol, nullptr));
}

HeldSymbol::~HeldSymbol() {
    if (m_Symbol) Release(*m_Symbol);
}

}  // namespace Korvel
