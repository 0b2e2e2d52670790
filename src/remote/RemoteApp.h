#pragma once

#include <atomic>
#include <cstdint>
#include <memory>

#include "Platform/Lock.h"
#include "core/OxString.h"
#include "core/ScriptVal.h"
#include "objects/ObjectReferences.h"
#include "remote/RemoteObject.h"

namespace Korvel::Platform {
struct _Socket;
struct _SocketSet;
}  // namespace Korvel::Platform

namespace Korvel {

class Packet;
class ScriptInfo;
template <class T>
class ptr;
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
// Threads:  any, for the public operations, where nothing else is said. Who cannot get a reply does
//           not wait for it, but fails at once, with a line in the log: code on the connection's
//           own thread, and the UI thread while a member that the peer has called waits for it.
// Limits:   the connection ends, with a line in the log, when the peer has shown no sign of life
//           for KORVEL_PeerTimeoutSeconds (90; up to 130 where it had stopped reading), when
//           the queue of packets to it exceeds KORVEL_MaxQueueSize (1024, in MiB), and when more
//           than KORVEL_StalledQueueSize of it (64, in MiB) does not move for KORVEL_StallSeconds
//           (60).
// Locks:    docs/threads.md has the order. No code of others runs under any of them.
class KORVEL_EXPORT RemoteApp : public ObjectReferences {
public:
    // With a socket it connects and tells the host.
    RemoteApp(const char* name, unsigned int ip, Platform::_Socket* socket);
    RemoteApp(const RemoteApp&) = delete;
    RemoteApp& operator=(const RemoteApp&) = delete;

    // The order of the virtual operations is a contract.

    virtual ~RemoteApp();

    // Takes over a connected socket and starts the thread; ends what was connected before. False,
    // with the socket closed, without a thread, descriptors or memory, on the connection's own
    // thread, while another thread connects it, and where the UI thread would wait for itself.
    virtual bool Connect(Platform::_Socket* socket);
    // Connects by address (in network order) and port, within the process where that is its own,
    // and shakes hands; ends what was connected before. False, and not connected, when nobody is
    // there or answers in time, when the peer refuses, when its UUID is not the one that this
    // connection has, while another thread connects it, and when that is cancelled. Without a UUID
    // it takes the peer's. It can be tried again. ScriptApp.h tells of `reply`.
    virtual bool Connect(unsigned int ip, unsigned int port, ScriptVal& reply);

    // Sends what is queued, for a second at most, ends the connection and waits for its thread to
    // do its last step, in milliseconds; 0xFFFFFFFF has no limit. On that thread itself it does not
    // wait. False when it was not connected, when the thread has not ended in time, and where the
    // UI thread would wait for itself.
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
    // connection does not export it, or it has died. The record may become another object's when
    // the peer lets go at the same time: HoldLocalObject gives the object itself.
    virtual RemoteObject* FindLocalObject(unsigned long long id);
    // One more, one less reference of this process to an object of the peer. The first makes the
    // proxy if need be; null for 0. The last DecRemoteRef tells the peer.
    virtual RemoteObject* IncRemoteRef(unsigned long long id);
    virtual void DecRemoteRef(unsigned long long id);

    virtual void Disconnect();

    // Packets. An object of this process in a reply is sure to be found there by callbacks, and by
    // Exchange: the peer may have let go of it when another thread opens the packet later.

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

    // Connects by what this connection has been made for: asks the script server at the host name
    // for the port of the application with the name, subtype and UUID, then connects by address.
    // Without a name, it connects to the script server itself. False as there, and when the server
    // is not there or knows no such application.
    virtual bool Connect(ScriptVal& reply);
    virtual bool Connect();
    // The same on a thread of its own. The host hears of it by OnConnect or OnConnectFailed. False,
    // with nothing done, when there is no thread, and while another thread connects it.
    virtual bool AsyncConnect();

    virtual bool Connected() const;
    virtual unsigned int GetIPAddress() const;    // in network order
    virtual OxStringT<char> GetName() const;      // as the peer claims
    virtual OxStringT<char> GetHostName() const;  // its address, as a text
    virtual ScriptVal GetUUID() const;            // of the peer, as it claims
    virtual bool ClearUUID();                     // false while connected
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

    // Joins two connections within the process. False when one of them is connected, or cannot be.
    static bool Join(RemoteApp* a, RemoteApp* b);

    // DoPkt for a packet that it takes over in any case; the second form also opens the reply, and
    // gives its second value. False when there was none.
    Packet* ExchangePkt(Packet* packet);
    bool Exchange(Packet* packet, ScriptVal& result);
    // Whether this thread may wait for a reply; else it tells the log why not.
    bool MayWait() const;

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
    void KeepError(const ScriptVal& results);  // of a call, where they have one
    uint32_t TakeLastError(OxStringT<char>& text);

    // The object of this process that has a number; no count. Null when there is none.
    static ScriptObject* GetObjectPtr(unsigned long long id);

    // The number of a proxy on the wire, UINT32_MAX for one of a run that has ended.
    uint32_t NumberOf(const RemoteObject& proxy) const;
    // What packets count, in the run that they belong to; 0 is any. The number of an object, as
    // _IncLocalRef counts it, 0 for none; and a proxy as IncRemoteRef gives it.
    uint32_t Export(ScriptObject* object, uint16_t run);
    RemoteObject* Import(uint32_t id, uint16_t run);

    // Each connecting is a new run, with a number of its own. IsRun asks whether it still goes on.
    uint16_t GetRun() const;
    bool IsRun(uint16_t run) const;
    // Lets all go that the peer of a run held. Nothing once another one has begun.
    void Cleanup(uint16_t run);

    // The calling thread begins or ends a wait for the UI thread.
    static void NoteWaitForUI(bool isWaiting);

    // The object with a number as FindLocalObject finds it, with one IncRef for the caller. Unlike
    // the fields of a record it stays what it is. Null also when number 1 has no object.
    ScriptObject* HoldLocalObject(unsigned long long id);

    // Nothing more is done for the peer of a run, which ends when its last reply has been sent.
    // Nothing at all once another run has begun.
    void Refuse(uint16_t run);

    // Whether the peer need not log in, or has done so, see ScriptConfig::Login. A host lets one in
    // that it has called and trusts.
    bool IsLoggedIn() const;
    void SetLoggedIn(uint16_t run);  // the peer of a run; nothing once another one has begun

    // Makes the attempt of another thread to connect this connection fail soon. It goes on for as
    // long as name servers take.
    void CancelConnect();

    // The peer's name and UUID, from keys 1 and 2. What it claims, cut to what there is room for.
    void SetConnectionInfo(ScriptVal& args);

    // What of a peer's text may stand in a log or on a terminal: at most 127 bytes, no control
    // characters.
    static OxStringT<char> CutName(const char* name);

    // Whether the peer runs on this machine, which no name server is asked for. False when not
    // connected.
    bool IsPeerLocal() const;

    // Whether an address is this machine's: 127.0.0.1, or one that leads to this machine's name. It
    // may wait for name servers.
    static bool IsLocalIP(unsigned int ip);
    static bool IsLocalIP(const char* address);
    // The address that four numbers with dots between them are, or that a machine of this name has;
    // 0 for none. For a name it may wait for name servers.
    static unsigned int IPFromStr(const char* text);
    // Writes an address as four numbers, cut to `length` - 1 bytes. Returns the bytes written.
    static int StrFromIP(unsigned int ip, char* text, int length);

protected:
    // A proxy of the peer's application object, connected or not. Nil without memory.
    ScriptVal GetRoot();
    // What is known of the peer. Texts are cut to what there is room for.
    void SetPeer(const char* name, const char* hostName, unsigned int ip, const ScriptVal& uuid,
                 const char* subtype = nullptr);

    void Enlist();  // on g_AppList
    // One more use, unless the last one has gone.
    bool UseIfHeld() const;

    // Tells the host that the connection is made, and from then on of its end, too.
    void ReportConnect();

    // What the engine asks of the tables, without holding a lock.

    // Before a run: makes the entries of number 1 and asks for the application's object; nothing
    // may be exported.
    void InitReferences();
    void HoldRoot();        // at its start: counts that object for the peer
    void FreeReferences();  // for the destructor

    // All references of the peer to the object with a number, in one step. False when it is not
    // exported or dead.
    bool DropLocalRefs(unsigned long long id);
    // One more reference to the object at an address that the peer has named. 0 when there is no
    // object there that scripts have ever seen.
    uint32_t ExportAddress(unsigned long long address);

private:
    friend class RemoteObject;
    friend ScriptVal ScriptApp(unsigned int ip, unsigned int port, ScriptVal& reply,
                               double timeOut);
    friend ScriptVal ScriptApp(RemoteApp* app, Platform::_Socket* socket, const char* name,
                               ScriptVal uuid);
    friend ScriptVal ScriptApp(const char* name, const char* subtype, ScriptVal uuid,
                               const char* host, double timeOut);
    friend ScriptVal AsyncScriptApp(const char* name, const char* subtype, ScriptVal uuid,
                                    const char* host, double timeOut, bool connect);
    friend void ForEachApp(void (*visit)(void* data, RemoteApp& app), void* data);

    // Connecting. One thread at a time has the turn, which the functions without a comment need.
    class ConnectTurn;
    bool BeginConnecting();  // takes the turn
    void EndConnecting();
    bool ConnectByName(ScriptVal& reply);
    bool ConnectByName(unsigned int ip, ScriptVal& reply);
    bool ConnectToServer(unsigned int ip);
    bool FindHost(unsigned int ip, ScriptVal& info);
    ScriptVal AskServer(ScriptVal& root);
    bool ConnectByAddress(unsigned int ip, unsigned int port, ScriptVal& reply);
    enum class PeerKind : uint8_t { Caller, Host, Server };  // the latter two called from here
    bool ConnectThere(unsigned int ip, unsigned int port, PeerKind kind);
    Platform::_Socket* DoConnectSock(unsigned int port, unsigned int ip, double timeOut);
    bool AwaitAnswer(Platform::_Socket* socket, double timeOut);
    bool ConnectHere();
    bool ShakeHands(ScriptVal& root, ScriptVal& reply);
    // One that is listed, to be connected by name.
    static ptr<RemoteApp> NewByName(const char* name, const char* subtype, const ScriptVal& uuid,
                                    const char* host, double timeOut);
    void EndAsyncConnect(bool isConnected);

    // On g_AppList
    void Delist();

    // A run
    bool ConnectOver(Platform::_Socket* socket, PeerKind kind);
    bool BeginRun();
    bool StartThread(Platform::_Socket* socket, RemoteApp* peer);
    bool PrepareLocked(Platform::_Socket* socket);
    void FreeSetLocked();
    bool IsConnectionThread() const;
    bool AwaitEnd(int64_t deadlineNs);
    void EndThread();
    void ReleaseUI();
    void LeavePeer();
    void CloseDown();
    void GiveUpRun();
    bool IsPeer(const RemoteApp* app) const;
    // With a text that stays; nothing in another run than the one with this number, if there is
    // one.
    void Close(const char* why, uint32_t run = 0);

    // Telling the host
    using UIStep = unsigned long long (*)(void* app, void* run);
    bool RunOnUI(UIStep step);
    void ReportEnd();
    bool SetReported(bool isReported);
    static unsigned long long TellConnect(void* app, void* run);
    static unsigned long long TellConnectFailed(void* app, void* run);
    static unsigned long long TellEnd(void* app, void* run);

    // Any thread
    uint32_t Submit(Packet* packet, Request* request);
    bool AddLocked(Request* request, uint32_t context);
    RemoteApp* HoldReaderLocked();
    uint32_t SendReplyPkt(Packet* packet);
    bool PostLocked(Packet* packet, uint64_t maxQueueSize);
    void Wake();
    const char* WhyNotWait(bool isFromUI) const;
    std::unique_ptr<Request> Ask(Packet* packet, bool wantsValues);
    std::unique_ptr<Request> WaitFor(Request* request, double timeOut);

    // The connection's thread
    void Sleep();
    unsigned int GetSleepMs();
    bool Serve();
    void StopSending();
    bool WriteSome();
    bool ReadSocket();
    bool TakeInput();
    bool FinishReading();
    void SetThreshold();
    bool ReadPeer();
    Packet* GetNextSendPacket();
    Packet* TakeFor(const RemoteApp* peer, bool mayWait);
    bool BeginLarge(uint32_t size, const unsigned char* bytes, uint32_t length);
    bool IsIdle() const;
    void EndOverdue(int64_t now);
    void CheckPeer(int64_t now);
    void DropRequests(Request* requests);

    // What has arrived; requests also on the UI thread
    void HandleReply(Packet* reply);
    bool OpenReply(Packet* reply);
    void HandleRequest(Packet* packet);
    void HandleScriptPacket(Packet* packet);
    void Reply(Packet* request, const ScriptVal* second = nullptr, uint32_t target = 0);
    void ReplyError(Packet* request, ScriptError code, const char* text = nullptr);
    void CallMember(Packet* packet);
    void CallMember(Packet* packet, ScriptObject* object, ScriptInfo* info);
    bool MayUseGiven() const;
    bool MayUse(uint32_t target) const;
    bool IsOpenToAll(uint32_t opcode, const ScriptArgs& args) const;
    bool RefuseStranger(Packet* packet, bool isKnown);
    void CountReference(Packet* packet);
    void GetInfo(Packet* packet);
    void TakeStateData(Packet* packet);
    void Drop(Packet* packet);
    bool PassToUI(Packet* packet);
    static unsigned long long DoPacket(void* app, void* packet);

    // Objects
    RemoteObject* IncLocal(ScriptObject* object, uint16_t run);
    ObjectRecord* CountExport(ScriptObject* object, uint16_t run, ScriptObject** held);
    ObjectRecord* AddExportLocked(ScriptObject* object, uint32_t id);
    ObjectRecord* FindExportLocked(const ScriptObject* object) const;
    ScriptObject* RemoveExportLocked(ObjectRecord* record);
    struct Released;
    Released DropExportLocked(ObjectRecord* record, uint32_t count);
    void Finish(const Released& released);
    ScriptObject* HoldObject(unsigned long long id, RemoteObject*& found);
    void Unpin(ObjectRecord* record);
    uint32_t ReleaseExports(uint16_t run);
    bool HasEndedLocked(uint16_t run) const;
    void CountProxyLocked(ObjectRecord* record);
    struct DroppedProxy;
    DroppedProxy DropProxyLocked(ObjectRecord* record);
    void Finish(const DroppedProxy& dropped);
    void DetachProxies();
    void IncProxy(RemoteObject* proxy);
    void DecProxy(RemoteObject* proxy);
    RemoteObject* CountProxy(unsigned long long id, uint16_t run, bool canAdd);
    void EndIfUnused();

    // Guarded by g_AppLock
    RemoteApp* m_Next = nullptr;
    RemoteApp** m_Link = nullptr;  // that points here; null when not on the list

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
    OxStringT<char> m_Subtype;  // that the script server is asked for
    OxStringT<char> m_HostName;
    unsigned int m_IP = 0;
    double m_TimeOut = 0;
    ScriptVal m_StateData;
    uint32_t m_LastError = 0;
    OxStringT<char> m_LastErrorText;

    KorvelScript::Lock m_DataLock;
    ScriptVal m_Data;  // guarded by m_DataLock
};

// Open connections of the process. Each counts until it asks the host's configuration no more.
KORVEL_EXPORT unsigned int GetNumConnections();

// Whether there has ever been one.
KORVEL_EXPORT extern std::atomic<bool> g_HasBeenConnected;

}  // namespace Korvel
