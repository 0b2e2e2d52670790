#pragma once

#include <atomic>
#include <memory>

#include "Platform/Event.h"
#include "Platform/EventQueue.h"
#include "objects/Publish.h"
#include "remote/HostRegistryInternal.h"
#include "remote/ListenerInternal.h"
#include "remote/ServerDiscoveryInternal.h"

namespace Korvel {

class HostApp;
class Packet;

// A call for the main loop. With an event somebody waits for the result, and deletes the node;
// without one, whoever runs it does.
class ExecNode : public KorvelScript::QueueNode {
public:
    using Function = unsigned long long (*)(void* a, void* b);

    ExecNode(Function function, void* a, void* b, KorvelScript::Event* done)
        : QueueNode(0), m_Done(done), m_Function(function), m_A(a), m_B(b) {}

    void Run();  // which ends it: the node may be gone
    unsigned long long GetResult() const { return m_Result; }

private:
    KorvelScript::Event* const m_Done;
    const Function m_Function;
    void* const m_A;
    void* const m_B;
    unsigned long long m_Result = 0;
};

// What the objects of the script server have in common: a count that starts at 0, and with whose
// end they go.
class ScriptServerObject : public Scripted<ScriptObject> {
    KORVEL_SCRIPTED(ScriptServerObject)
public:
    ScriptServerObject() { SetScriptClass(); }
    void IncRef() override;
    void DecRef() override;

private:
    std::atomic<uint32_t> m_UseCount{0};
};

// The script server: the application object of every connection to its port.
//
// Threads: members run on the threads of connections, and never wait for one. Main is one thread's,
//          which alone does what others put on its queue.
class ScriptServerApp : public ScriptServerObject {
    KORVEL_SCRIPTED(ScriptServerApp)
public:
    ScriptServerApp() { SetScriptClass(); }

    void Main();  // until there is nobody to serve

    // Has the main loop do something. Put takes the node over; it is false when the loop has ended.
    bool Put(std::unique_ptr<ExecNode>& node);
    unsigned long long Execute(ExecNode::Function function, void* a, void* b, bool wait);

    // On the main loop, when a connection has ended.
    void Forget(HostApp& app);

private:
    struct Sockets;

    // Members
    bool AddHost(ScriptArgs& args);
    bool RemoveHost(const ScriptVal& processID);
    bool StartHost(const RemoteApp* caller, const char* name, const char* command, bool force,
                   uint64_t& processID);
    void NotifyHosts(const char* name, const ScriptVal& value, const RemoteApp* butOf);

    // The main loop
    bool Open(Sockets& sockets);
    void Serve(Sockets& sockets);
    void Accept(Sockets& sockets);
    void ServeDatagram(Sockets& sockets);
    bool IsDone(bool hasTimedOut);
    void RunQueue();
    void PingHosts();
    static bool TakePingReply(void* serial, RemoteApp* app, Packet* reply, unsigned int context);

    HostRegistry m_Hosts;
    KorvelScript::EventQueue m_Queue;

    // The main loop's
    unsigned int m_NumIdlePasses = 0;
    unsigned int m_NumApps = 0;  // that have not been forgotten
    AnswerLimiter m_Limiter;
};

// Prints a line to standard output at once, or not at all when nobody takes it: who reads what the
// server prints may have gone to sleep.
void PrintServerLine(const char* format, ...) KORVEL_PRINTF(1, 2);

}  // namespace Korvel
