// The objects of either side that the other one holds.
//
// An exported object stands in two tables: that of the process, which gives it its number, and that
// of each connection that knows it. A record of a connection carries one IncRef of the object and
// one count in the process's record, from its making to its removal, whatever the peer counts. When
// the object dies before, the process's record goes, and what connections have of it is stale: it
// is found no more, and is freed when the peer or the connection lets go of it.
//
// Objects are foreign code. They are counted with no lock held: before their record is made, after
// it has been removed, and while a pin keeps it.
#include <cstdio>
#include <typeinfo>
#include <utility>

#include "Platform/NoKillInternal.h"
#include "core/ScriptHooksInternal.h"
#include "core/SpinLockInternal.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptObject.h"
#include "remote/ObjectTableInternal.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr uint32_t kStuckCount = UINT32_MAX;  // a count that came this far is not counted any more
constexpr uint32_t kAllCounts = UINT32_MAX;

constinit SpinLock s_LocalLock;

// Guarded by s_LocalLock. The count of a record is the number of connections that know the object.
// Never destroyed: objects of hosts live longer than our static objects.
constinit ObjectTable s_LocalObjectList;
constinit uint32_t s_NextLocalID = kRootID + 1;
constinit uint64_t s_NextSerial = 1;
constinit uint64_t s_NumDeaths = 0;  // of exported objects

// Holds s_LocalLock.
struct AutoLocalLock : AutoPlacedLock {
    AutoLocalLock() : AutoPlacedLock(LockRank::Exports, s_LocalLock) {}
};

// After four thousand million exports the numbers begin again.
uint32_t TakeNextIDLocked() {
    uint32_t id;
    do {
        id = s_NextLocalID++;
        if (s_NextLocalID == kNoID) s_NextLocalID = kRootID + 1;
    } while (s_LocalObjectList.Find(id));
    return id;
}

// The process's record of an exported object; null when the object has died. Number and address may
// be those of an application object that came after.
ObjectRecord* FindKnownLocked(const ObjectRecord* record) {
    ObjectRecord* known = record->m_Known;
    return known && known->m_Serial == record->m_Serial ? known : nullptr;
}

// The same as a question, which mostly spares a look at the other record.
bool IsAliveLocked(ObjectRecord* record) {
    if (record->m_SeenAt == s_NumDeaths) return true;
    if (!FindKnownLocked(record)) return false;
    record->m_SeenAt = s_NumDeaths;
    return true;
}

void CountUp(ObjectRecord* record) {
    if (record->m_Count != kStuckCount) record->m_Count++;
}

void TraceLocalToRemote(const RemoteApp& app, uint64_t address, uint32_t id) {
    Platform::NoKill noKill;
    char result[16] = "Failed";
    if (id) snprintf(result, sizeof result, "%u", id);
    printf("App %p, %lld: LocalToRemote(%p) -> %s\n", static_cast<const void*>(&app),
           static_cast<long long>(app.GetID()), reinterpret_cast<void*>(address), result);
}

}  // namespace

// What has been taken out of the tables, and is let go of without their locks.
struct RemoteApp::Released {
    ScriptObject* m_Object = nullptr;  // to be given its DecRef
    bool m_HasUse = false;             // the record's use of the connection
    bool m_WasLast = false;            // the peer holds nothing any more
};

struct RemoteApp::Tables {
    Tables() = default;
    Tables(const Tables&) = delete;
    Tables& operator=(const Tables&) = delete;
    ~Tables() {
        m_Local.Clear();
        m_Remote.Clear();
    }

    ObjectTable m_Local;
    ObjectTable m_Remote;
};

// Number 1

void RemoteApp::InitReferences() {
    if (!m_Tables) m_Tables = new Tables;
    ScriptObject* root = GetAppObject();
    if (!ObjectReferences::AddObjectReference(root)) root = nullptr;  // its death must be noticed
    if (root) root->IncRef();
    ScriptObject* old = nullptr;
    {
        AutoAppLock guard(m_Lock);
        AutoLocalLock localGuard;
        ObjectRecord* record = m_Tables->m_Local.Find(kRootID);
        if (record && !record->m_Count && !record->m_Pins) {
            old = RemoveExportLocked(std::exchange(record, nullptr));
        }
        if (!record && AddExportLocked(root, kRootID)) root = nullptr;
        // A thread that is counting it keeps it.
        if (record && record->m_Object == root) record->m_IsLeaving = false;
    }
    DetachProxies();
    if (root) root->DecRef();
    if (old) old->DecRef();
}

// What the last peer has given leads to nobody now, whatever number it had.
void RemoteApp::DetachProxies() {
    AutoAppLock guard(m_Lock);
    ObjectTable& proxies = m_Tables->m_Remote;
    for (RemoteObjectChunk* chunk = proxies.GetChunks(); chunk; chunk = chunk->m_Next) {
        for (ObjectRecord& proxy : *chunk) {
            if (proxy.m_ID && proxy.m_ID != kRootID && !proxy.m_IsDetached) proxies.Detach(&proxy);
        }
    }
    if (!proxies.Find(kRootID)) proxies.Add(kRootID, this, false, nullptr);
}

uint32_t RemoteApp::NumberOf(const RemoteObject& proxy) const {
    AutoAppLock guard(m_Lock);
    return static_cast<const ObjectRecord&>(proxy).m_IsDetached ? kNoID : proxy.m_ID;
}

void RemoteApp::HoldRoot() {
    if (ScriptObject* root = HoldLocalObject(kRootID)) {
        _IncLocalRef(root);
        root->DecRef();
    }
    AutoAppLock guard(m_Lock);
    m_Traffic->m_IsServing = true;
}

// Objects of this process

// The record of an object that lives; stale ones of its address do not count.
ObjectRecord* RemoteApp::FindExportLocked(const ScriptObject* object) const {
    return m_Tables->m_Local.FindIf(object, IsAliveLocked);
}

// A record that holds the caller's IncRef from here on. `id` 0 stands for the number that the
// object has or gets. Null without memory.
ObjectRecord* RemoteApp::AddExportLocked(ScriptObject* object, uint32_t id) {
    if (!object) return m_Tables->m_Local.Add(id, this, true, nullptr);
    // Another connection may have made it number 1, which is a different object on this one.
    ObjectRecord* known = s_LocalObjectList.FindIf(object, [&](const ObjectRecord* record) {
        return id ? record->m_ID == id : !m_Tables->m_Local.Find(record->m_ID);
    });
    if (!known) {
        known = s_LocalObjectList.Add(id ? id : TakeNextIDLocked(), nullptr, true, object);
        if (!known) return nullptr;
        known->m_Type = &typeid(*object);
        known->m_Serial = s_NextSerial++;
    }
    ObjectRecord* record = m_Tables->m_Local.Add(known->m_ID, this, true, object);
    if (record) {
        record->m_Type = known->m_Type;
        record->m_Known = known;
        record->m_Serial = known->m_Serial;
        record->m_SeenAt = s_NumDeaths;
        known->m_Count++;
    } else if (!known->m_Count) {
        s_LocalObjectList.Remove(known);
    }
    return record;
}

// Frees a record. Returns the object whose IncRef it held; null when the object is dead.
ScriptObject* RemoteApp::RemoveExportLocked(ObjectRecord* record) {
    ObjectRecord* known = FindKnownLocked(record);
    ScriptObject* object = known ? known->m_Object : nullptr;
    if (known && --known->m_Count == 0) s_LocalObjectList.Remove(known);
    m_Tables->m_Local.Remove(record);
    return object;
}

// One more reference to an object that is exported, in the run with a number or in any. One that is
// not is added if the caller `held` it by an IncRef: this is then null, the record has it.
ObjectRecord* RemoteApp::CountExport(ScriptObject* object, uint16_t run, ScriptObject** held) {
    AutoAppLock guard(m_Lock);
    if (!Connected() || (run && run != m_Traffic->m_Run)) return nullptr;
    AutoLocalLock localGuard;
    ObjectRecord* record = FindExportLocked(object);
    if (!record) {
        record = held ? AddExportLocked(*held, 0) : nullptr;
        if (!record) return nullptr;
        *held = nullptr;
    }
    record->m_IsLeaving = false;
    if (!record->m_Count) {
        m_LocalCount++;
        Use();
    }
    CountUp(record);
    return record;
}

RemoteObject* RemoteApp::_IncLocalRef(void* object) {
    return IncLocal(static_cast<ScriptObject*>(object), 0);
}

RemoteObject* RemoteApp::IncLocal(ScriptObject* object, uint16_t run) {
    if (!object) return nullptr;
    if (ObjectRecord* record = CountExport(object, run, nullptr)) return record;
    if (!Connected() || !ObjectReferences::AddObjectReference(object)) return nullptr;
    object->IncRef();
    ScriptObject* held = object;
    ObjectRecord* record = CountExport(object, run, &held);
    // Its owner may have taken it back just before: its death must be noticed all the same.
    if (record) ObjectReferences::AddObjectReference(object);
    if (held) held->DecRef();
    return record;
}

uint32_t RemoteApp::Export(ScriptObject* object, uint16_t run) {
    RemoteObject* record = IncLocal(object, run);
    if (!record) return 0;
    AutoAppLock guard(m_Lock);
    return record->m_Object == object ? record->m_ID : 0;
}

// Takes up to `count` references off. With the last the record goes, or with its last pin.
RemoteApp::Released RemoteApp::DropExportLocked(ObjectRecord* record, uint32_t count) {
    Released released;
    if (count < record->m_Count) {
        if (record->m_Count != kStuckCount) record->m_Count -= count;
        return released;
    }
    if (record->m_Count) {
        record->m_Count = 0;
        released.m_HasUse = true;
        released.m_WasLast = --m_LocalCount == 0;
    }
    record->m_IsLeaving = record->m_Pins > 0;
    if (!record->m_IsLeaving) released.m_Object = RemoveExportLocked(record);
    return released;
}

void RemoteApp::Finish(const Released& released) {
    if (released.m_Object) released.m_Object->DecRef();
    if (released.m_WasLast) OnZeroLocalCount();
    if (released.m_HasUse) Recycle();
}

bool RemoteApp::_DecLocalRef(void* pointer) {
    auto* object = static_cast<ScriptObject*>(pointer);
    Released released;
    bool isAlive;
    {
        AutoAppLock guard(m_Lock);
        AutoLocalLock localGuard;
        ObjectRecord* record = FindExportLocked(object);
        isAlive = record != nullptr;
        if (!isAlive) record = m_Tables->m_Local.Find(object);
        if (!record || record->m_IsLeaving) return false;
        released = DropExportLocked(record, 1);
    }
    Finish(released);
    return isAlive;
}

bool RemoteApp::DropLocalRefs(unsigned long long id) {
    Released released;
    bool isAlive;
    {
        AutoAppLock guard(m_Lock);
        AutoLocalLock localGuard;
        ObjectRecord* record = m_Tables->m_Local.Find(id);
        if (!record || record->m_IsLeaving) return false;
        isAlive = !record->m_Object || IsAliveLocked(record);
        released = DropExportLocked(record, kAllCounts);
    }
    Finish(released);
    return isAlive;
}

ScriptObject* RemoteApp::HoldObject(unsigned long long id, RemoteObject*& found) {
    ObjectRecord* record;
    ScriptObject* object;
    {
        AutoAppLock guard(m_Lock);
        AutoLocalLock localGuard;
        record = m_Tables->m_Local.Find(id);
        if (!record || record->m_IsLeaving) return nullptr;
        object = record->m_Object;
        if (object && !IsAliveLocked(record)) return nullptr;
        found = record;
        if (!object) return nullptr;
        record->m_Pins++;
    }
    object->IncRef();
    Unpin(record);
    return object;
}

void RemoteApp::Unpin(ObjectRecord* record) {
    ScriptObject* object = nullptr;
    {
        AutoAppLock guard(m_Lock);
        if (--record->m_Pins || !record->m_IsLeaving) return;
        AutoLocalLock localGuard;
        object = RemoveExportLocked(record);
    }
    if (object) object->DecRef();
}

RemoteObject* RemoteApp::FindLocalObject(unsigned long long id) {
    RemoteObject* found = nullptr;
    HoldObject(id, found);
    return found;
}

ScriptObject* RemoteApp::HoldLocalObject(unsigned long long id) {
    RemoteObject* found = nullptr;
    return HoldObject(id, found);
}

// The address is looked up before anything is done with it. An object that its owner destroys at
// this moment is as unsafe as for any other thread that uses it.
uint32_t RemoteApp::ExportAddress(unsigned long long address) {
    auto* object = reinterpret_cast<ScriptObject*>(static_cast<uintptr_t>(address));
    return ObjectReferences::GetObjectReference(object) ? Export(object, 0) : 0;
}

ScriptObject* RemoteApp::GetObjectPtr(unsigned long long id) {
    AutoLocalLock guard;
    ObjectRecord* record = s_LocalObjectList.Find(id);
    return record ? record->m_Object : nullptr;
}

// Removes all records that no peer is in the middle of counting, a chunk at a time. Returns the
// uses of this connection that they held.
uint32_t RemoteApp::ReleaseExports(uint16_t run) {
    uint32_t numUses = 0;
    RemoteObjectChunk* chunk;
    {
        AutoAppLock guard(m_Lock);
        chunk = m_Tables->m_Local.GetChunks();
    }
    for (; chunk; chunk = chunk->m_Next) {
        ScriptObject* objects[RemoteObjectChunk::kSize];
        int count = 0;
        {
            AutoAppLock guard(m_Lock);
            if (!HasEndedLocked(run)) break;
            AutoLocalLock localGuard;
            for (ObjectRecord& record : *chunk) {
                if (!record.m_ID || record.m_IsLeaving) continue;
                Released released = DropExportLocked(&record, kAllCounts);
                if (released.m_Object) objects[count++] = released.m_Object;
                numUses += released.m_HasUse;
            }
        }
        for (int i = 0; i < count; i++) objects[i]->DecRef();
    }
    return numUses;
}

bool RemoteApp::HasEndedLocked(uint16_t run) const {
    return !Connected() && m_Traffic->m_Run == run;
}

void RemoteApp::Cleanup(uint16_t run) {
    uint32_t numUses = ReleaseExports(run);
    bool isLast = false;
    if (numUses) {
        AutoAppLock guard(m_Lock);
        isLast = HasEndedLocked(run);
    }
    if (isLast) OnZeroLocalCount();
    while (numUses--) Recycle();
}

void RemoteApp::FreeReferences() {
    ReleaseExports(GetRun());
    delete std::exchange(m_Tables, nullptr);
}

void RemoteApp::OnZeroLocalCount() {
    EndIfUnused();
}
void RemoteApp::OnZeroRemoteCount() {
    EndIfUnused();
}

// Looks again, since the counts may have gone up meanwhile.
void RemoteApp::EndIfUnused() {
    {
        AutoAppLock guard(m_Lock);
        // A run that has just begun has not counted number 1 yet.
        if (m_LocalCount || m_RemoteCount || !m_Traffic->m_IsServing) return;
    }
    Disconnect();
}

// Proxies

void RemoteApp::CountProxyLocked(ObjectRecord* record) {
    if (!record->m_Count) {
        m_RemoteCount++;
        Use();
    }
    CountUp(record);
}

RemoteObject* RemoteApp::CountProxy(unsigned long long id, uint16_t run, bool canAdd) {
    if (!id || id > UINT32_MAX) return nullptr;
    AutoAppLock guard(m_Lock);
    if (run && run != m_Traffic->m_Run) return nullptr;
    ObjectTable& table = m_Tables->m_Remote;
    ObjectRecord* record = table.Find(id);
    if (!record && canAdd) record = table.Add(static_cast<uint32_t>(id), this, false, nullptr);
    if (record) CountProxyLocked(record);
    return record;
}

RemoteObject* RemoteApp::IncRemoteRef(unsigned long long id) {
    return CountProxy(id, 0, true);
}

RemoteObject* RemoteApp::Import(uint32_t id, uint16_t run) {
    return CountProxy(id, run, true);
}

// A proxy that has been taken out of its table.
struct RemoteApp::DroppedProxy {
    uint32_t m_ID = 0;  // 0 when it stays
    uint16_t m_Run = 0;
    bool m_WasLast = false;
};

RemoteApp::DroppedProxy RemoteApp::DropProxyLocked(ObjectRecord* record) {
    if (!record || !record->m_Count || record->m_Count == kStuckCount) return {};
    if (--record->m_Count) return {};
    uint32_t id = NumberOf(*record);
    m_Tables->m_Remote.Remove(record);
    return {id, m_Traffic->m_Run, --m_RemoteCount == 0};
}

void RemoteApp::Finish(const DroppedProxy& dropped) {
    if (!dropped.m_ID) return;
    // What nobody can name counts for nobody.
    Packet* packet = dropped.m_ID != kNoID && Connected()
                         ? CreatePkt(PKT_NoMoreRefs, this, nullptr, nullptr)
                         : nullptr;
    if (packet) {
        packet->m_Target = dropped.m_ID;
        packet->m_Reserved = dropped.m_Run;
        if (!DoPktAsync(packet, nullptr, nullptr)) FreePkt(packet);
    }
    if (dropped.m_WasLast) OnZeroRemoteCount();
    Recycle();
}

void RemoteApp::DecRemoteRef(unsigned long long id) {
    DroppedProxy dropped;
    {
        AutoAppLock guard(m_Lock);
        dropped = DropProxyLocked(m_Tables->m_Remote.Find(id));
    }
    Finish(dropped);
}

// By the record: when its run has ended, its number may be another one's.
void RemoteApp::IncProxy(RemoteObject* proxy) {
    AutoAppLock guard(m_Lock);
    CountProxyLocked(static_cast<ObjectRecord*>(proxy));
}

void RemoteApp::DecProxy(RemoteObject* proxy) {
    DroppedProxy dropped;
    {
        AutoAppLock guard(m_Lock);
        dropped = DropProxyLocked(static_cast<ObjectRecord*>(proxy));
    }
    Finish(dropped);
}

ScriptVal RemoteApp::FindRemoteObject(unsigned long long id) {
    RemoteObject* proxy = CountProxy(id, 0, false);
    if (!proxy) return {};
    ScriptVal value;
    value.Set(SV_RemoteObject, &proxy);
    DecProxy(proxy);  // the value has a count of its own
    return value;
}

RemoteObject* RemoteApp::LocalToRemote(unsigned long long address) {
    Packet* packet = CreatePkt(PKT_LocalToRemote, this, nullptr, nullptr);
    if (packet) {
        packet->m_Symbol = static_cast<uint32_t>(address);
        packet->m_Target = static_cast<uint32_t>(address >> 32);
    }
    uint32_t id = 0;
    RemoteObject* proxy = nullptr;
    if (Packet* reply = ExchangePkt(packet)) {
        id = reply->m_Target;
        proxy = IncRemoteRef(id);  // ahead of DropPkt, which counts it, too, and lets go of it
        DropPkt(this, reply);
    }
    if (GetFlags() & PKF_Trace) TraceLocalToRemote(*this, address, id);
    return proxy;
}

// What values and objects ask

namespace {

// Takes all records of an object out of the process's table, so that no connection finds it.
bool ForgetExports(ScriptObject* object, bool dropCounts) {
    uint32_t count = 0;
    bool isKnown = false;
    {
        AutoLocalLock guard;
        while (ObjectRecord* known = s_LocalObjectList.Find(object)) {
            isKnown = true;
            count += known->m_Count;
            s_LocalObjectList.Remove(known);
        }
        s_NumDeaths += isKnown;
    }
    while (dropCounts && count--) object->DecRef();
    return isKnown;
}

// The pointer of a proxy tells that the object was of this process when the proxy came; it may have
// died, and the connection may since have been made to another process.
ScriptObject* GetLocalPointer(RemoteObject* proxy) {
    RemoteApp* app = proxy->m_App;
    {
        AutoAppLock guard(app->GetLock());
        if (!proxy->m_Object || app->GetSocket() != kInProcess) return nullptr;
    }
    return RemoteApp::GetObjectPtr(proxy->m_ID);
}

// A connection has one proxy for each number.
bool IsSameRemote(RemoteObject* a, RemoteObject* b) {
    return a == b;
}

const bool s_HasHooks = [] {
    ScriptHooks& hooks = g_ScriptHooks;
    hooks.m_UseApp = [](RemoteApp* app) { app->Use(); };
    hooks.m_RecycleApp = [](RemoteApp* app) { app->Recycle(); };
    hooks.m_IsConnected = [](RemoteApp* app) { return app->Connected(); };
    hooks.m_IncRemoteRef = [](RemoteObject* proxy) { proxy->IncRef(); };
    hooks.m_DecRemoteRef = [](RemoteObject* proxy) { proxy->DecRef(); };
    hooks.m_GetRemoteApp = [](RemoteObject* proxy) { return proxy->m_App; };
    hooks.m_GetLocalPointer = GetLocalPointer;
    hooks.m_IsSameRemote = IsSameRemote;
    hooks.m_DoCommand = [](RemoteObject* proxy, int opcode, ScriptArgs& args, ScriptVal& reply) {
        return proxy->DoCommand(opcode, args, reply);
    };
    hooks.m_DoCommandAsync = [](RemoteObject* proxy, int opcode, ScriptArgs& args,
                                AsyncCallback callback, void* context) {
        return proxy->DoCommandAsync(opcode, args, callback, context) != 0;
    };
    hooks.m_ForgetExports = ForgetExports;
    return true;
}();

}  // namespace
}  // namespace Korvel
