#pragma once

#include <atomic>
#include <cstdint>

#include "Platform/Lock.h"
#include "core/OxString.h"
#include "core/ScriptVal.h"
#include "objects/ObjectReferences.h"
#include "remote/RemoteObject.h"

namespace Korvel::Platform {
struct _Event;
struct _Socket;
struct _SocketSet;
struct _Thread;
}  // namespace Korvel::Platform

namespace Korvel {

class Packet;
struct ObjectRecord;
struct Request;

// What stands for the socket of a connection within the process.
inline Platform::_Socket* const kInProcess = reinterpret_cast<Platform::_Socket*>(intptr_t{-2});

// A connection to another process. It moves packets both ways, matches replies with requests, hands
// requests to the members of exported objects, and counts the objects that either side holds of the
// other.
//
// Form:     over a socket, with a thread of its own that does all reading and writing; or within
//           the process, two connections that take packets from each other.
// Lifetime: Use and Recycle; the last Recycle destroys the object. The running thread, each record
//           of an object and each ScriptArgs with this connection hold a use. After the connection
//           has ended the object can be connected again.
// Ending:   Disconnect closes when nothing is under way any more, _Disconnect at once. A connection
//           through which neither side holds anything of the other closes by itself. Whoever waits
//           for a reply then gets null.
// Threads:  any, for the public operations, where nothing else is said. Code on the connection's
// own
//           thread cannot wait for a reply on it: such calls fail at once, with a line in the log.
// Locks:    docs/threads.md has the order. No code of others runs under any of them.
class KORVEL_EXPORT RemoteApp : public ObjectReferences {
public:
    RemoteApp(const char* name, unsigned int ip, Platform::_Socket* socket);
    RemoteApp(const RemoteApp&) = delete;
    RemoteApp& operator=(const RemoteApp&) = delete;

    // The order of the virtual operations is a contract.

    virtual ~RemoteApp();

    // Takes over a connected socket and starts the thread; ends what was connected before. False,
    // with the socket closed, when there is no thread or no memory.
    virtual bool Connect(Platform::_Socket* socket);
    // TODO(remote): connects by address and port, and shakes hands. False so far.
    virtual bool Connect(unsigned int ip, unsigned int port, ScriptVal& reply);

    // Ends the connection and waits for its thread, in milliseconds; 0xFFFFFFFF has no limit. False
    // when it is not connected or the thread has not ended in time.
    virtual bool _Disconnect(unsigned int waitMs);
    virtual void AppThreadFunc();  // the body of the thread

    // One more, one less reference of the peer to an object of this process, which the caller keeps
    // alive meanwhile. The first gives the record; null for null, without memory, and when not
    // connected. The second is false when there was nothing to count, and when the object is dead.
    // The object is held by one IncRef for each connection that it is known on.
    virtual RemoteObject* _IncLocalRef(void* object);
    virtual bool _DecLocalRef(void* object);

    virtual void Use() const;
    virtual void Recycle() const;

    // Locks the connection's store and gives a table in it, made if need be.
    virtual ScriptVal& LockData(const char* key);
    virtual void UnlockData();

    // A proxy by its number, nil when there is none; it holds a count.
    virtual ScriptVal FindRemoteObject(unsigned long long id);
    // An exported object by its number, with one IncRef on it for the caller; null when this
    // connection does not export it, or it has died.
    virtual RemoteObject* FindLocalObject(unsigned long long id);
    // One more, one less reference of this process to an object of the peer. The first makes the
    // proxy if need be; null for 0. The last DecRemoteRef tells the peer.
    virtual RemoteObject* IncRemoteRef(unsigned long long id);
    virtual void DecRemoteRef(unsigned long long id);

    virtual void Disconnect();

    // Puts a packet on the queue, which takes it over. Returns the request's number; 0, with the
    // packet freed, when not connected. A reply keeps its number.
    virtual uint32_t SendPkt(Packet* packet);
    // The reply to a request, the caller's; null when it has not come within the time-out.
    virtual Packet* WaitPkt(uint32_t context);
    // Sends and waits. Null also when not connected: then the packet is still the caller's.
    virtual Packet* DoPkt(Packet* packet);
    // Sends; the callback gets the reply on the connection's thread, or null when there will be
    // none. It returns true when it has taken the packet over. Without a callback the reply is
    // freed. Returns 0 when not connected; then the packet is still the caller's.
    virtual uint32_t DoPktAsync(Packet* packet, AsyncCallback callback, void* data);

    virtual int WriteData(void* data, int length);
    virtual int ReadData(void* data, int length);
    virtual void DoRead();
    virtual void DoWrite();
    virtual void DispatchPacket(Packet* packet);

    // TODO(remote): connect by name. False so far.
    virtual bool Connect(ScriptVal& reply);
    virtual bool Connect();
    virtual bool AsyncConnect();

    virtual bool Connected() const;
    virtual unsigned int GetIPAddress() const;  // in network order
    virtual OxStringT<char> GetName() const;    // as the peer claims
    virtual OxStringT<char> GetHostName() const;
    virtual ScriptVal GetUUID() const;  // of the peer, as it claims
    virtual bool ClearUUID();           // false while connected
    virtual bool IsUUID(const ScriptVal& uuid) const;
    virtual Platform::_Socket* GetSocket() const;

    // The last object of ours that the peer held is gone; the last object of its that we held.
    virtual void OnZeroLocalCount();
    virtual void OnZeroRemoteCount();

    // How long WaitPkt and DoPkt wait, in seconds; 0 is for ever. Returns the old value.
    virtual double SetTimeOut(double seconds);
    virtual double GetTimeOut() const;

    // Asks the peer for its object at an address, as FindRemoteObject gives it; null for none.
    virtual RemoteObject* LocalToRemote(unsigned long long address);
    // Keeps a state's data and sends it to the peer.
    virtual void SetStateData(const ScriptVal& data);

    // Joins two connections within the process. False when one of them is connected.
    static bool Join(RemoteApp* a, RemoteApp* b);

    // DoPkt for a packet that it takes over in any case.
    Packet* ExchangePkt(Packet* packet);

    // The same as WaitPkt with a time-out of its own: 0 is for ever, below 0 only looks.
    Packet* WaitPkt(uint32_t context, double timeOut);
    Packet* PollPkt(uint32_t context);  // only looks

    uint64_t GetID() const { return m_AppID; }
    uint32_t GetUseCount() const { return m_UseCount; }
    KorvelScript::Lock& GetLock() { return m_Lock; }

    // Bit 31: the connection prints what passes through it.
    uint32_t GetFlags() const { return m_Flags; }
    void SetFlags(uint32_t bits) { m_Flags |= bits; }
    void ClearFlags(uint32_t bits) { m_Flags &= ~bits; }

    // The error of the last reply that had one; it stays until it is taken.
    void SetLastError(uint32_t number, const char* text);
    uint32_t TakeLastError(OxStringT<char>& text);

    // The object of this process that has a number; no count. Null when there is none.
    static ScriptObject* GetObjectPtr(unsigned long long id);

    // The peer's name and UUID, from keys 1 and 2. What it claims, cut to what there is room for.
    void SetConnectionInfo(ScriptVal& args);

protected:
    // Whether calls would wait for the thread that makes them.
    bool IsConnectionThread() const;

    // What the engine asks of the tables, without holding a lock.

    // Makes the entries of number 1, for a new object; nothing may be exported.
    void InitReferences();
    // At the start of a run, once Connected(): asks for the application's object again, and counts
    // it for the peer.
    void HoldRoot();
    // After a run, or when connecting has failed: all that the peer held goes. Nothing when
    // connected.
    void CleanUpReferences();
    void FreeReferences();  // for the destructor

    // The object with a number as FindLocalObject finds it, with one IncRef for the caller. Unlike
    // the fields of a record it stays what it is. Null also when number 1 has no object.
    ScriptObject* HoldLocalObject(unsigned long long id);
    // All references of the peer to the object with a number, in one step. False when it is not
    // exported or dead.
    bool DropLocalRefs(unsigned long long id);
    // One more reference to the object at an address that the peer has named. Null when there is no
    // object there that scripts have ever seen.
    RemoteObject* ExportAddress(unsigned long long address);

private:
    friend class RemoteObject;

    // Any thread
    uint32_t Submit(Packet* packet, Request* request);
    uint32_t SendReplyPkt(Packet* packet);
    bool PostLocked(Packet* packet);
    void Wake();
    bool CanWait() const;
    Packet* WaitFor(Request* request, double timeOut);
    bool LookForReply(const Request& request);
    void Close(const char* why);

    // The connection's thread
    bool StartThread();
    void Sleep();
    unsigned int GetSleepMs();
    bool Serve();
    bool ReadSocket();
    bool TakeInput();
    bool FinishReading();
    void ReadPeer();
    Packet* TakeOutgoing();
    bool IsIdle();
    void EndOverdue();
    void DropRequests(Request* requests);
    void CloseDown();

    // What has arrived; requests also on the UI thread
    void HandleReply(Packet* reply);
    void HandleRequest(Packet* packet);
    void HandleScriptPacket(Packet* packet);
    void CallMember(Packet* packet);
    void CountReference(Packet* packet);
    void GetInfo(Packet* packet);
    void TakeStateData(Packet* packet);
    bool PassToUI(Packet* packet);
    static unsigned long long DoPacket(void* app, void* packet);

    // Objects
    ObjectRecord* CountExport(ScriptObject* object, ScriptObject** held);
    ObjectRecord* AddExportLocked(ScriptObject* object, uint32_t id);
    ObjectRecord* FindExportLocked(const ScriptObject* object) const;
    ScriptObject* RemoveExportLocked(ObjectRecord* record);
    struct Released;
    Released DropExportLocked(ObjectRecord* record, uint32_t count);
    void Finish(const Released& released);
    ScriptObject* HoldObject(unsigned long long id, RemoteObject*& found);
    void Unpin(ObjectRecord* record);
    uint32_t ReleaseExports();
    RemoteObject* CountProxy(unsigned long long id, bool canAdd);
    void EndIfUnused();

    mutable std::atomic<uint32_t> m_UseCount{1};
    const uint64_t m_AppID;
    std::atomic<uint32_t> m_Flags{0};

    mutable KorvelScript::Lock m_Lock;

    // Guarded by m_Lock
    struct Traffic;
    Traffic* const m_Traffic;
    struct Tables;
    Tables* m_Tables = nullptr;  // objects on either side
    uint32_t m_LocalCount = 0;   // exported objects in use
    uint32_t m_RemoteCount = 0;  // proxies in use
    ScriptVal m_UUID;
    OxStringT<char> m_Name;
    OxStringT<char> m_HostName;
    unsigned int m_IP = 0;
    double m_TimeOut = 0;
    ScriptVal m_StateData;
    uint32_t m_LastError = 0;
    OxStringT<char> m_LastErrorText;

    KorvelScript::Lock m_DataLock;
    ScriptVal m_Data;  // guarded by m_DataLock
};

// Open connections of the process.
KORVEL_EXPORT unsigned int GetNumConnections();

}  // namespace Korvel
