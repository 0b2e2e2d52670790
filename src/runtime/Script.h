#pragma once

#include <atomic>

#include "Platform/EventQueue.h"
#include "Platform/Thread.h"
#include "core/ScriptVal.h"
#include "core/SpinLock.h"
#include "objects/ScriptConfig.h"

namespace Korvel::KorvelScript {

class ScriptDebug;
class ScriptLanguage;
class ScriptState;
struct DebugHookData;

// Flags of a state.
constexpr unsigned int STF_Announce = 0x1;      // NewState tells the host when it has started
constexpr unsigned int STF_NoThread = 0x2;      // the host runs it, see ScriptState::Run
constexpr unsigned int STF_Trace = 0x80000000;  // prints each message it handles

// Flags of the calls that send a message.
constexpr unsigned int SEXEC_Print = 0x1;        // print the value of the text
constexpr unsigned int SEXEC_Dump = 0x2;         // dump it, whatever SEXEC_Print says
constexpr unsigned int SEXEC_Interactive = 0x4;  // text from a prompt: incomplete input gives 3
constexpr unsigned int SEXEC_NoWait = 0x8;       // send and return 0 at once
constexpr unsigned int SEXEC_KeepArgs = 0x10;    // Python 2: leave the script's arguments alone

// What runs return.
enum : unsigned int {
    SRES_Done = 0,
    SRES_Failed = 1,      // reported through DoError; also when the state has ended
    SRES_Incomplete = 3,  // only with SEXEC_Interactive
};

// When the host's setup callback comes.
enum eSCSetupState : unsigned int {
    SCSETUP_New = 1,      // the state is being constructed: it is not to be called yet
    SCSETUP_Ending = 2,   // the last reference goes away; the thread still runs
    SCSETUP_Started = 3,  // the thread has started; only with STF_Announce
};

enum eScriptMessage : unsigned int {
    SMSG_Quit = 1,
    SMSG_Execute,
    SMSG_ExecuteFile,
    SMSG_Call,  // nobody sends or handles it
    SMSG_SetGlobal,
    SMSG_SetGlobalObject,
    SMSG_GetGlobal,
    SMSG_GetGlobalType,
    SMSG_SetThisApp,
    SMSG_SetArgs,
    SMSG_SetPathMap,
    SMSG_SetPrintFuncs,
    SMSG_CollectGarbage,
    SMSG_EnableDebug,
    SMSG_Sync,
    SMSG_Done,
};

// The names of the messages by number; the first is empty.
KORVEL_EXPORT extern const char* const s_ScriptMsgs[SMSG_Done + 1];

// Work for a state. Its sender owns it until ScriptState::DoMessage.
class KORVEL_EXPORT ScriptMessage : public QueueNode {
public:
    explicit ScriptMessage(eScriptMessage type) : QueueNode(type) {}

    // With a waiter: wakes him, and the message is his. Without one: deletes the message.
    void Reply() override;

    ScriptObject* m_Object = nullptr;
    Event* m_ReplyEvent = nullptr;  // set while somebody waits
    ScriptVal m_Value;
    OxID m_Name;
    OxID m_Name2;
    unsigned int m_Flags = 0;
    unsigned int m_Count = 0;
    void* m_Args[3] = {};
    unsigned int m_GlobalType = SV_Nil;  // set by the handler
    unsigned int m_Result = 0;           // set by the handler
    uint64_t m_ObjectRef = 0;
    bool m_IsAbandoned = false;  // its handler was killed: not to be read, and never destroyed
};

// Put on the queue that was given to ScriptState::Sync; its taker ends it by Reply.
class KORVEL_EXPORT SyncMessage : public QueueNode {
public:
    SyncMessage(ScriptState* state, unsigned int number)
        : QueueNode(0), m_State(state), m_Number(number) {}

    ScriptState* const m_State;
    const unsigned int m_Number;
};

// An interpreter with a thread and a queue of its own. All work for it travels as messages and is
// done on its thread, one message after the other, in the order in which each sender sent them.
//
// Lifetime: a state comes from ScriptLanguage::GetState or NewState and goes back with Done. Where
//           its script may not end, Shutdown ends it; then, or where the state is not to go back,
//           the last Recycle destroys it. The last Recycle waits for what is under way. From the
//           state's own thread it cannot: there it returns at once, and the state goes when the
//           message in hand has been handled.
// Ending:   messages that the state has not come to when it ends, and those sent later, are
//           answered with result 1. No caller hangs. A state whose thread was killed stays in
//           memory for good, with its interpreter: nobody knows what state they are in.
// Threads:  the public operations, from any thread that holds a reference, where nothing else is
//           said. Those with an underscore are the back end's, called on the state's thread with
//           the state lock held. A waiting call on the state's own thread (from a print function)
//           is handled at once, in the middle of what the state does.
// Texts:    of programs, names and files are copied. They must not begin with byte 0xFF.
class KORVEL_EXPORT ScriptState : public Thread, public MinNode {
public:
    using PrintFunc = void (*)(void* userData, const char* text);
    using PumpFunc = void (*)(ScriptState* state, void* user);

    // `object` is not used.
    ScriptState(ScriptLanguage* language, ScriptObject* object, unsigned int flags);
    ~ScriptState() override;

    unsigned int SizeOf() override { return sizeof(ScriptState); }
    void Use() const override;
    void Recycle() const override;
    int Main() override;

    // The order of the virtual operations is a contract.

    virtual void _SetPrintFuncs(PrintFunc print, PrintFunc error, void* userData,
                                unsigned int flags);
    // To the host's functions, else to standard output and standard error.
    virtual void _DoPrint(const char* text);
    virtual void _DoError(const char* text);
    virtual void _SetBreakLevel(int level) { m_BreakLevel = level; }
    virtual int _GetBreakLevel() { return m_BreakLevel; }
    virtual bool _IsDebug() { return m_DebugEnabled; }
    virtual void _EnableDebug(bool enable);
    virtual ScriptDebug* _GetDebug();  // made when first asked for; null without a debugger
    virtual unsigned int _Execute(const char* text, unsigned int flags, const char* name) = 0;
    virtual unsigned int _ExecuteFile(const char* file, unsigned int flags, const char* name) = 0;
    virtual unsigned int _Call(const char* name, const char* first, ...) = 0;
    virtual void _SetGlobal(const char* name, const ScriptVal& value, unsigned int flags) = 0;
    virtual void _SetGlobalObject(const char* name, const ScriptObject* object,
                                  unsigned long long reference, unsigned int flags) = 0;
    virtual unsigned int _GetGlobal(const char* name, ScriptVal& value, unsigned int flags) = 0;
    virtual unsigned int _GetGlobalType(const char* name, unsigned int flags) = 0;
    virtual void _SetThisApp(const char* name, const char* shortName) = 0;
    virtual void _SetArgs(char** argv, int argc) = 0;
    virtual void _CollectGarbage() = 0;
    virtual void* _GetRawState() = 0;
    virtual void _Init() = 0;  // at the start of the thread, without the lock
    virtual void _SetPathMap(const ScriptVal& map) = 0;
    virtual ScriptVal& _LockStateData();
    virtual void _UnlockStateData();

    // Handles messages until the state is told to end: the body of a state with STF_NoThread, on a
    // thread of the host's choice. Nobody lets go of the last reference while it begins. 0, or 1
    // when the state is not of that kind or has been run.
    virtual int Run();

    // Runs a text, or a file. `name` is shown in messages; may be null. Returns a result as above.
    unsigned int Execute(const char* text, unsigned int flags = 0, const char* name = nullptr);
    unsigned int ExecuteFile(const char* file, unsigned int flags = 0, const char* name = nullptr);

    // Does nothing; always 1.
    using ScriptObject::Call;
    unsigned int Call(const char* name, const char* first, ...);

    void SetGlobal(const char* name, const ScriptVal& value, unsigned int flags = 0);
    // The object must live until the state has the message.
    void SetGlobalObject(const char* name, ScriptObject* object, unsigned int flags = 0);
    // Always waits. A global that is not there is a nil.
    unsigned int GetGlobal(const char* name, ScriptVal& value, unsigned int flags = 0);
    unsigned int GetGlobalType(const char* name, unsigned int flags = 0);  // an SV_ type

    // Makes the host's application known to the scripts, under these names.
    void SetThisApp(const char* name, const char* shortName, unsigned int flags = 0);

    // The script's arguments, texts up to a null pointer. Waits.
    void SetArgs(char** argv, int argc);

    void SetPathMap(const ScriptVal& map);         // does not wait
    ScriptVal& GetPathMap() { return m_PathMap; }  // for the state's thread

    // Where the script's output goes, called on the state's thread, and for what finalisers print
    // at the very end on the thread that destroys the state. Null functions: see _DoPrint.
    void SetPrintFuncs(PrintFunc print, PrintFunc error, void* userData, unsigned int flags = 0);

    void CollectGarbage(unsigned int flags = 0);
    void EnableDebug(bool enable);  // waits

    // Puts a SyncMessage on the queue when all that was sent before has been handled, or refused
    // because the state has ended; the queue must live until then. Does not wait. Returns the
    // message's number; the first one is 1.
    unsigned int Sync(EventQueue* target);

    // Gives the state back to its language's pool, with the reference; from the state's own thread
    // when the message in hand has been handled. 0, or 1 when that cannot be: it has been done
    // already, or the state has ended and the reference is still the caller's. Print functions stay
    // as they are, so set them to null before where they do not outlive the use.
    unsigned int Done(unsigned int flags = 0);

    // Sends a message of the caller's own. Without SEXEC_NoWait: waits, and returns the message's
    // result; the message is replied to, and so deleted, if `free` is set, else it is the caller's
    // again, unless m_IsAbandoned says that it is nobody's. With it: takes the message over and
    // returns 0.
    unsigned int DoMessage(ScriptMessage* message, unsigned int flags, bool free);

    // Ends the state's thread: asks it to, calls `pump` (may be null) each 5 milliseconds
    // meanwhile, and kills the thread when it has not ended within the time. The state can then
    // only be recycled. HasEnded is false afterwards where the thread could not be killed; the last
    // Recycle then waits for it. Without a thread it waits for the end of Run, however long that
    // takes. Called on the state's own thread it does not wait: the state ends after the message
    // in hand.
    void Shutdown(double seconds, PumpFunc pump, void* user);

    bool IsNoThread() const { return GetFlags(STF_NoThread) != 0; }
    unsigned int GetFlags(unsigned int mask) const { return m_Flags & mask; }
    void SetFlags(unsigned int bits);
    void ClearFlags(unsigned int bits);
    ScriptLanguage* GetLanguage() const { return m_Language; }

    // The interpreter itself, for the state's thread alone.
    void* GetRawState() { return _GetRawState(); }

    // On the state's thread.
    void DoPrint(const char* text) { _DoPrint(text); }
    void DoError(const char* text) { _DoError(text); }

    void SetBreakLevel(int level) { _SetBreakLevel(level); }
    int GetBreakLevel() { return _GetBreakLevel(); }

    // Blocks while a script runs on the state's thread.
    bool IsDebug();
    bool IsDebugAvailable();
    // The one debugger, borrowed until ReleaseDebug; null when it has been given out.
    ScriptDebug* ObtainDebug();
    void ReleaseDebug(ScriptDebug* debug);
    void DebugHook(DebugHookData* data);  // on the state's thread

    // Data of the host's that goes with the state, a table. After a change, the second shows it to
    // the application's connection. Neither locks anything.
    ScriptVal& LockStateData() { return _LockStateData(); }
    void UnlockStateData() { _UnlockStateData(); }

    void Setup(eSCSetupState stage, TagList* tags = nullptr);

    // Whether the thread or Run has ended, by itself or by force.
    bool HasEnded() const { return m_HasEnded; }

    // What the last run has left, for its sender once it has returned: the first result if that was
    // a number, else nil; for a run that failed, where it failed, line by line, else empty.
    const ScriptVal& GetRunResult() const { return m_RunResult; }
    const OxStringT<char>& GetTraceback() const { return m_Traceback; }

    // For back ends, on the state's thread.
    void SetRunResult(const ScriptVal& result) { m_RunResult = result; }
    void SetTraceback(const char* text) { m_Traceback = text; }

protected:
    bool IsOwnThread() const;

    // The connection to the application that SetThisApp has named, borrowed; null without one.
    RemoteApp* GetThisApp() const { return m_ThisApp; }

private:
    friend class ScriptLanguage;

    bool StartThread();
    bool Post(ScriptMessage* message);
    void PostQuit(unsigned int flags);
    unsigned int PostAndWait(ScriptMessage* message);

    // On the state's thread
    bool Serve();
    bool HandleBatch(ScriptMessage*& quit);
    bool End(ScriptMessage* quit);
    ScriptMessage* Take();
    void Answer(ScriptMessage* message);
    void Refuse(ScriptMessage* message);
    void ReportException(const char* text);
    void HandleMessage(ScriptMessage* message);
    void Handle(ScriptMessage& message);
    unsigned int HandleRun(const ScriptMessage& message);
    void HandleThisApp(const ScriptMessage& message);

    void Quit();
    void KillScript();
    void RefuseRest();
    void EndReturn(ScriptMessage& message);
    void AwaitServed();
    template <class Look>
    bool LookLocked(Look&& look);
    RemoteApp* UseThisApp() const;

    ScriptLanguage* const m_Language;

    // State thread only
    void* m_PrintData = nullptr;
    PrintFunc m_Print = nullptr;
    PrintFunc m_Error = nullptr;
    bool m_DebugEnabled = false;

    std::atomic<int> m_BreakLevel{0};
    std::atomic<bool> m_DebugObtained{false};
    std::atomic<ScriptDebug*> m_Debug{nullptr};  // owned
    EventQueue m_Queue;
    Lock m_StateLock;  // held while a batch of messages is handled
    std::atomic<unsigned int> m_SyncCounter{0};
    RemoteApp* m_ThisApp = nullptr;  // holds a use; guarded by m_RefLock
    std::atomic<unsigned int> m_Flags;
    ScriptVal m_StateData;
    ScriptVal m_PathMap;

    // State thread while something runs, then its sender
    ScriptVal m_RunResult;
    OxStringT<char> m_Traceback;

    // Makes a look at the use count and the drop that follows one step; guards m_ThisApp.
    mutable NestedSpinLock m_RefLock;

    Platform::_Thread* m_Handle = nullptr;           // set when started; a reference of its own
    std::atomic<unsigned long long> m_ThreadID{0};   // of the thread that serves, while it does
    std::atomic<bool> m_IsServing{false};            // the last thing that thread touches
    std::atomic<bool> m_HasServed{false};            // it has begun, once
    std::atomic<ScriptMessage*> m_Current{nullptr};  // taken from the queue and not yet answered
    std::atomic<bool> m_IsDone{false};               // given back, or on the way
    std::atomic<bool> m_IsPooled{false};             // on the language's list
    std::atomic<bool> m_HasEnded{false};
    std::atomic<bool> m_IsKilled{false};
    std::atomic<bool> m_EndsItself{false};  // after the message in hand
    bool m_DeletesItself = false;           // and the object with it; state thread only
};

}  // namespace Korvel::KorvelScript
