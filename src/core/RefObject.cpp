#include "core/RefObject.h"

#include <bit>

#include "core/ScriptVal.h"
#include "core/TagList.h"

namespace Korvel {
namespace {

constinit std::atomic<uint32_t> g_InitUseCount{1};

int32_t InitialUses() {
    return static_cast<int32_t>(g_InitUseCount.load(std::memory_order_relaxed));
}

}  // namespace

extern "C" void SetInitUseCount(uint32_t count) {
    g_InitUseCount = count;
}
extern "C" uint32_t GetInitUseCount() {
    return g_InitUseCount;
}

RefObject::RefObject() : UseCount(InitialUses()) {}
RefObject::RefObject(const RefObject& other) : _Object(other), UseCount(InitialUses()) {}
RefObject& RefObject::operator=(const RefObject& other) {
    _Object::operator=(other);
    return *this;
}

void RefObject::GetObjectInfo(const ScriptVal& query, ScriptVal& result) {
    if (DoInfo(query, result, "UseCount")) result["UseCount"] = GetUseCount();
}

// Whatever the tag's type, what is written fits into the word.
uint64_t RefObject::GetAttrWord(unsigned long long tag, uint64_t word) const {
    if (TypeOfTag(tag) != TAG_ID) CopyAttr(tag, &word);
    return word;
}

uint32_t RefObject::GetAttr(unsigned long long tag, uint32_t def) const {
    return static_cast<uint32_t>(GetAttrWord(tag, def));
}
double RefObject::GetAttrD(unsigned long long tag, double def) const {
    return std::bit_cast<double>(GetAttrWord(tag, std::bit_cast<uint64_t>(def)));
}
void* RefObject::GetAttrPtr(unsigned long long tag, void* def) const {
    return reinterpret_cast<void*>(GetAttrWord(tag, reinterpret_cast<uint64_t>(def)));
}
bool RefObject::GetAttrB(unsigned long long tag, bool def) const {
    return GetAttr(tag, def) != 0;
}
OxID RefObject::GetAttrID(unsigned long long tag, const OxID& def) const {
    OxID id(def);
    if (TypeOfTag(tag) == TAG_ID) CopyAttr(tag, &id);
    return id;
}

void RefObject::Use() const {
    if (!IsNull(this)) UseCount.fetch_add(1);
}
void RefObject::Recycle() const {
    if (!IsNull(this) && UseCount.fetch_sub(1) == 1) delete this;
}

void RefCount::Use() const {
    if (!IsNull(this)) m_Count.fetch_add(1);
}
void RefCount::Recycle() const {
    if (!IsNull(this) && m_Count.fetch_sub(1) == 1) delete this;
}

}  // namespace Korvel
