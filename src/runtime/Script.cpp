// A state's life: the thread takes messages from the queue (Serve), until SMSG_Quit, or until the
// state has ended itself. Then the queue is closed, what is left is refused, and the last thing
// that the thread does with the state is to answer the SMSG_Quit.
#include "runtime/Script.h"

#include <cstdio>
#include <exception>
#include <memory>
#include <new>
#include <utility>

#include "Platform/NoKillInternal.h"
#include "Platform/ThreadInternal.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"
#include "core/ScriptHooksInternal.h"
#include "remote/RemoteApp.h"
#include "runtime/RuntimeHooksInternal.h"
#include "runtime/ScriptDebug.h"
#include "runtime/ScriptLanguage.h"

namespace Korvel::KorvelScript {
namespace {

constexpr unsigned int kQueueWaitMs = 1000;
constexpr unsigned int kPumpMs = 5;
constexpr unsigned int kPollMs = 1;

// What a killed thread may have been writing to is neither used again nor destroyed. It is kept
// where leak checkers see it.
void Abandon(MinNode* node) {
    Platform::NoKill noKill;
    static Lock& lock = *new Lock;
    static MinList& graveyard = *new MinList;
    AutoLock guard(lock);
    graveyard.Add(node);
}

double NowMs() {
    return static_cast<double>(Platform::GetTimeCount()) * 1000 /
           static_cast<double>(Platform::GetTimeFreq());
}

// Makes a message, has it filled in and sends it; its result, or 0 if nobody waits.
template <class Fill>
unsigned int Send(ScriptState* state, eScriptMessage type, unsigned int flags, Fill&& fill) {
    ScriptMessage* message = new ScriptMessage(type);
    if (message) fill(*message);
    return state->DoMessage(message, flags, true);
}

}  // namespace

const char* const s_ScriptMsgs[SMSG_Done + 1] = {
    "",
    "SMSG_Quit",
    "SMSG_Execute",
    "SMSG_ExecuteFile",
    "SMSG_Call",
    "SMSG_SetGlobal",
    "SMSG_SetGlobalObject",
    "SMSG_GetGlobal",
    "SMSG_GetGlobalType",
    "SMSG_SetThisApp",
    "SMSG_SetArgs",
    "SMSG_SetPathMap",
    "SMSG_SetPrintFuncs",
    "SMSG_CollectGarbage",
    "SMSG_EnableDebug",
    "SMSG_Sync",
    "SMSG_Done",
};

void ScriptMessage::Reply() {
    if (!m_ReplyEvent) {
        delete this;
        return;
    }
    // From the signal on the message is the waiter's.
    std::exchange(m_ReplyEvent, nullptr)->Signal();
}

// Construction and references

ScriptState::ScriptState(ScriptLanguage* language, ScriptObject*, unsigned int flags)
    : m_Language(language), m_Flags(flags) {
    Setup(SCSETUP_New);
}

ScriptState::~ScriptState() {
    m_Queue.Close();
    RefuseRest();  // what came for a state that was never started
    delete m_Debug.load();
    if (m_ThisApp) g_ScriptHooks.m_RecycleApp(m_ThisApp);
    Platform::DeleteThread(m_Handle);
}

void ScriptState::Use() const {
    RefObject::Use();
}

void ScriptState::Recycle() const {
    {
        AutoNestedSpinLock guard(m_RefLock);
        if (GetUseCount() != 1) return RefObject::Recycle();
    }
    const_cast<ScriptState*>(this)->Quit();
}

// The last reference goes away.
void ScriptState::Quit() {
    Setup(SCSETUP_Ending);
    if (IsOwnThread()) {
        m_EndsItself = true;
        m_DeletesItself = true;
        SetDeleteOnQuit(!IsNoThread());
        return;
    }
    if (IsNoThread()) {
        if (m_IsServing) PostQuit(0);
        AwaitServed();
    } else {
        if (IsRunning()) PostQuit(SEXEC_NoWait);
        if (m_Handle) Platform::WaitThread(m_Handle, Platform::kNoTimeLimit);
    }
    if (m_IsKilled) return Abandon(this);
    if (ScriptDebug* debug = m_Debug) debug->CleanUp();
    RefObject::Recycle();
}

// Without memory for the message the end is asked for in another way; nobody hangs for that.
void ScriptState::PostQuit(unsigned int flags) {
    if (ScriptMessage* quit = new ScriptMessage(SMSG_Quit)) {
        DoMessage(quit, flags, true);
    } else {
        m_EndsItself = true;
        m_Queue.Signal();
    }
}

// The thread of Run has let go of the state.
void ScriptState::AwaitServed() {
    while (m_IsServing) Platform::Wait(kPollMs);
}

// The body needs the lock before it can come to its end, and with it the handle.
bool ScriptState::StartThread() {
    Platform::NoKill noKill;
    AutoLock guard(m_StateLock);
    m_Handle = Start();
    if (m_Handle) Platform::HoldThread(m_Handle);
    return m_Handle != nullptr;
}

bool ScriptState::IsOwnThread() const {
    unsigned long long thread = m_ThreadID.load(std::memory_order_relaxed);
    return thread && thread == Platform::GetCurrentThreadID();
}

void ScriptState::Setup(eSCSetupState stage, TagList* tags) {
    ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (config && config->Setup) config->Setup(this, stage, config->m_UserData, tags);
}

// Sending

bool ScriptState::Post(ScriptMessage* message) {
    return message && m_Queue.Put(message);
}

// The message stays the caller's, unless the thread that had it in hand was killed.
unsigned int ScriptState::PostAndWait(ScriptMessage* message) {
    if (!message) return SRES_Failed;
    if (IsOwnThread()) {
        HandleMessage(message);
        return message->m_Result;
    }
    // On the heap: a waiter that is killed leaves it behind, not a stack that is gone.
    std::unique_ptr<Event> reply(new (std::nothrow) Event);
    if (!reply || !reply->GetEvent()) return SRES_Failed;
    message->m_ReplyEvent = reply.get();
    if (!Post(message)) {
        Refuse(message);
        message->Reply();
    }
    reply->Wait(Platform::kNoTimeLimit);
    return message->m_Result;
}

unsigned int ScriptState::DoMessage(ScriptMessage* message, unsigned int flags, bool free) {
    if (flags & SEXEC_NoWait) {
        if (message && !Post(message)) {
            Refuse(message);
            message->Reply();
        }
        return SRES_Done;
    }
    unsigned int result = PostAndWait(message);
    if (free && message) {
        if (message->m_IsAbandoned) {
            Abandon(message);
        } else {
            message->Reply();
        }
    }
    return result;
}

unsigned int ScriptState::Execute(const char* text, unsigned int flags, const char* name) {
    return Send(this, SMSG_Execute, flags, [&](ScriptMessage& message) {
        message.m_Name = OxID(text, true);
        message.m_Name2 = OxID(name, true);
        message.m_Flags = flags;
    });
}
unsigned int ScriptState::ExecuteFile(const char* file, unsigned int flags, const char* name) {
    return Send(this, SMSG_ExecuteFile, flags, [&](ScriptMessage& message) {
        message.m_Name = OxID(file, true);
        message.m_Name2 = OxID(name, true);
        message.m_Flags = flags;
    });
}

unsigned int ScriptState::Call(const char*, const char*, ...) {
    return SRES_Failed;
}

void ScriptState::SetGlobal(const char* name, const ScriptVal& value, unsigned int flags) {
    Send(this, SMSG_SetGlobal, flags, [&](ScriptMessage& message) {
        message.m_Name = OxID(name, true);
        message.m_Value = value;
        message.m_Flags = flags;
    });
}
void ScriptState::SetGlobalObject(const char* name, ScriptObject* object, unsigned int flags) {
    Send(this, SMSG_SetGlobalObject, flags, [&](ScriptMessage& message) {
        message.m_Name = OxID(name, true);
        message.m_Object = object;
        message.m_ObjectRef = RemoteApp::AddObjectReference(object);
        message.m_Flags = flags;
    });
}

unsigned int ScriptState::GetGlobal(const char* name, ScriptVal& value, unsigned int flags) {
    value = SV_Nil;
    std::unique_ptr<ScriptMessage> message(new ScriptMessage(SMSG_GetGlobal));
    if (!message) return SRES_Failed;
    message->m_Name = OxID(name, true);
    message->m_Flags = flags;
    unsigned int result = DoMessage(message.get(), 0, false);
    if (message->m_IsAbandoned) {
        Abandon(message.release());
    } else {
        value = std::move(message->m_Value);
    }
    return result;
}
unsigned int ScriptState::GetGlobalType(const char* name, unsigned int flags) {
    std::unique_ptr<ScriptMessage> message(new ScriptMessage(SMSG_GetGlobalType));
    if (!message) return SV_Nil;
    message->m_Name = OxID(name, true);
    message->m_Flags = flags;
    DoMessage(message.get(), 0, false);
    unsigned int type = message->m_GlobalType;
    if (message->m_IsAbandoned) Abandon(message.release());
    return type;
}

void ScriptState::SetThisApp(const char* name, const char* shortName, unsigned int flags) {
    Send(this, SMSG_SetThisApp, flags, [&](ScriptMessage& message) {
        message.m_Name = OxID(name, true);
        message.m_Name2 = OxID(shortName, true);
    });
}
void ScriptState::SetArgs(char** argv, int argc) {
    Send(this, SMSG_SetArgs, 0, [&](ScriptMessage& message) {
        message.m_Args[0] = argv;
        message.m_Count = static_cast<unsigned int>(argc);
    });
}
void ScriptState::SetPathMap(const ScriptVal& map) {
    Send(this, SMSG_SetPathMap, SEXEC_NoWait,
         [&](ScriptMessage& message) { message.m_Value = map; });
}
void ScriptState::SetPrintFuncs(PrintFunc print, PrintFunc error, void* userData,
                                unsigned int flags) {
    Send(this, SMSG_SetPrintFuncs, flags, [&](ScriptMessage& message) {
        message.m_Args[0] = userData;
        message.m_Args[1] = reinterpret_cast<void*>(print);
        message.m_Args[2] = reinterpret_cast<void*>(error);
        message.m_Flags = flags;
    });
}
void ScriptState::CollectGarbage(unsigned int flags) {
    Send(this, SMSG_CollectGarbage, flags, [](ScriptMessage&) {});
}
void ScriptState::EnableDebug(bool enable) {
    Send(this, SMSG_EnableDebug, 0, [&](ScriptMessage& message) { message.m_Flags = enable; });
}
unsigned int ScriptState::Sync(EventQueue* target) {
    unsigned int number = ++m_SyncCounter;
    Send(this, SMSG_Sync, SEXEC_NoWait, [&](ScriptMessage& message) {
        message.m_Count = number;
        message.m_Args[0] = target;
    });
    return number;
}

// The language stays until the state has got there, or nowhere: a message of this function's counts
// as one that returns (m_Count) until it has been handled or refused.
unsigned int ScriptState::Done(unsigned int flags) {
    if (m_IsDone.exchange(true)) return SRES_Failed;
    ScriptMessage* message = new ScriptMessage(SMSG_Done);
    unsigned int result = SRES_Failed;
    if (message) {
        message->m_Count = 1;
        m_Language->m_NumReturning++;
        if (!(flags & SEXEC_NoWait) && !IsOwnThread()) {
            result = DoMessage(message, flags, true);
        } else if (Post(message)) {
            result = SRES_Done;
        } else {
            Refuse(message);
            message->Reply();
        }
    }
    // When it has been done, the state may be anybody's; else it is still the caller's.
    if (result != SRES_Done) m_IsDone = false;
    return result;
}

// The state's thread

int ScriptState::Main() {
    Serve();
    return 0;
}

int ScriptState::Run() {
    if (!IsNoThread() || m_HasServed) return 1;
    if (Serve()) delete this;
    return 0;
}

// True when the object is to be destroyed; otherwise it may be gone already.
bool ScriptState::Serve() {
    if (m_HasServed.exchange(true)) return false;
    m_IsServing = true;
    Platform::SetThreadName("ScriptState", nullptr);
    m_ThreadID = Platform::GetCurrentThreadID();
    _Init();
    while (true) {
        m_Queue.Wait(kQueueWaitMs);
        ScriptMessage* quit = nullptr;
        if (HandleBatch(quit)) return End(quit);
    }
}

// Handles all that is queued; true when the state is to end.
bool ScriptState::HandleBatch(ScriptMessage*& quit) {
    AutoLock guard(m_StateLock);
    while (!m_EndsItself) {
        ScriptMessage* message = Take();
        if (!message) return false;
        if (message->GetType() == SMSG_Quit) {
            quit = message;
            return true;
        }
        HandleMessage(message);
        Answer(message);
    }
    return true;
}

bool ScriptState::End(ScriptMessage* quit) {
    bool deletesItself = m_DeletesItself;
    m_Queue.Close();
    RefuseRest();
    m_ThreadID = 0;
    m_HasEnded = true;
    ScriptDebug* debug = m_Debug;
    if (deletesItself && debug) debug->CleanUp();
    if (quit) {
        m_Current = quit;
        Answer(quit);
    }
    m_IsServing = false;
    return deletesItself;
}

// A message is always on the queue, or in hand, or answered: a kill finds it.
ScriptMessage* ScriptState::Take() {
    Platform::NoKill noKill;
    auto* message = static_cast<ScriptMessage*>(m_Queue.Get());
    m_Current = message;
    return message;
}

// A message that nobody waits for may run host code when it goes, and that no guard can keep.
void ScriptState::Answer(ScriptMessage* message) {
    if (message->m_ReplyEvent) {
        Platform::NoKill noKill;
        m_Current = nullptr;
        message->Reply();
    } else {
        m_Current = nullptr;
        message->Reply();
    }
}

// What is left to do for a message that is answered without having been handled. A receiver of
// SyncMessages waits for each of them.
void ScriptState::Refuse(ScriptMessage* message) {
    Platform::NoKill noKill;
    message->m_Result = SRES_Failed;
    if (message->GetType() == SMSG_Sync) Handle(*message);
    EndReturn(*message);
}

void ScriptState::RefuseRest() {
    while (ScriptMessage* message = Take()) {
        Refuse(message);
        Answer(message);
    }
}

// The language need not wait for the state any more, if it has.
void ScriptState::EndReturn(ScriptMessage& message) {
    if (message.GetType() == SMSG_Done && std::exchange(message.m_Count, 0)) {
        m_Language->m_NumReturning--;
    }
}

void ScriptState::HandleMessage(ScriptMessage* message) {
    bool isTraced = GetFlags(STF_Trace) != 0;
    if (isTraced) {
        Platform::NoKill noKill;
        unsigned int type = message->GetType();
        const char* name = message->m_Name;
        printf("\nScr %p: %p:%s \"%s\"\n", static_cast<void*>(this), static_cast<void*>(message),
               type <= SMSG_Done ? s_ScriptMsgs[type] : "", name ? name : "");
    }
    try {
        Handle(*message);
    } catch (const std::exception& error) {
        message->m_Result = SRES_Failed;
        ReportException(error.what());
    }
    if (isTraced) {
        Platform::NoKill noKill;
        printf("Scr %p: Reply %p\n", static_cast<void*>(this), static_cast<void*>(message));
    }
}

// A callback of the host's has thrown where no script could be told.
void ScriptState::ReportException(const char* text) {
    try {
        _DoError(text);
        _DoError("\n");
    } catch (const std::exception&) {
        g_ScriptHooks.m_Log(text);
    }
}

void ScriptState::Handle(ScriptMessage& message) {
    switch (message.GetType()) {
        case SMSG_Quit:
            m_EndsItself = true;
            break;
        case SMSG_Execute:
        case SMSG_ExecuteFile:
            message.m_Result = HandleRun(message);
            break;
        case SMSG_SetGlobal:
            _SetGlobal(message.m_Name, message.m_Value, message.m_Flags);
            break;
        case SMSG_SetGlobalObject:
            _SetGlobalObject(message.m_Name, message.m_Object, message.m_ObjectRef,
                             message.m_Flags);
            break;
        case SMSG_GetGlobal:
            message.m_Result = _GetGlobal(message.m_Name, message.m_Value, message.m_Flags);
            break;
        case SMSG_GetGlobalType:
            message.m_GlobalType = _GetGlobalType(message.m_Name, message.m_Flags);
            break;
        case SMSG_SetThisApp:
            HandleThisApp(message);
            break;
        case SMSG_SetArgs:
            _SetArgs(static_cast<char**>(message.m_Args[0]), static_cast<int>(message.m_Count));
            break;
        case SMSG_SetPathMap:
            m_PathMap = message.m_Value;
            _SetPathMap(m_PathMap);
            break;
        case SMSG_SetPrintFuncs:
            _SetPrintFuncs(reinterpret_cast<PrintFunc>(message.m_Args[1]),
                           reinterpret_cast<PrintFunc>(message.m_Args[2]), message.m_Args[0],
                           message.m_Flags);
            break;
        case SMSG_CollectGarbage:
            _CollectGarbage();
            break;
        case SMSG_EnableDebug:
            _EnableDebug(message.m_Flags == 1);
            break;
        case SMSG_Sync:
            if (EventQueue* target = static_cast<EventQueue*>(message.m_Args[0])) {
                std::unique_ptr<SyncMessage> sync(new SyncMessage(this, message.m_Count));
                if (target->Put(sync.get())) (void)sync.release();
            }
            break;
        case SMSG_Done:
            _CollectGarbage();
            {
                Platform::NoKill noKill;  // in one step
                m_Language->PutState(this);
                EndReturn(message);
            }
            break;
        default:
            break;
    }
}

unsigned int ScriptState::HandleRun(const ScriptMessage& message) {
    bool isText = message.GetType() == SMSG_Execute;
    m_RunResult = SV_Nil;
    m_Traceback = nullptr;
    if (!message.m_Name.IsValid()) {
        _DoError(isText ? "There is no text to execute." : "There is no file name to execute.");
        _DoError("\n");
        return SRES_Failed;
    }
    ScriptDebug* debug = _IsDebug() ? m_Debug.load() : nullptr;
    if (debug) debug->DoStart();
    unsigned int result = SRES_Failed;
    try {
        result = isText ? _Execute(message.m_Name, message.m_Flags, message.m_Name2)
                        : _ExecuteFile(message.m_Name, message.m_Flags, message.m_Name2);
    } catch (const std::exception& error) {
        ReportException(error.what());
    }
    debug = _IsDebug() ? m_Debug.load() : nullptr;
    if (debug) debug->DoStop();
    return result;
}

void ScriptState::HandleThisApp(const ScriptMessage& message) {
    _SetThisApp(message.m_Name, message.m_Name2);
    ScriptVal value;
    if (_GetGlobal(message.m_Name, value, 0) != 0) return;
    RemoteApp* app = value.GetApp();
    if (app) g_ScriptHooks.m_UseApp(app);
    {
        AutoNestedSpinLock guard(m_RefLock);
        std::swap(app, m_ThisApp);
    }
    if (app) g_ScriptHooks.m_RecycleApp(app);
    SetFlags(0);
}

// Ending by force

void ScriptState::Shutdown(double seconds, PumpFunc pump, void* user) {
    if (IsOwnThread()) {
        m_EndsItself = true;
        return;
    }
    if (IsNoThread()) {
        PostQuit(0);
        return AwaitServed();
    }
    if (!IsRunning()) return;
    PostQuit(SEXEC_NoWait);
    double deadline = NowMs() + (seconds > 0 ? seconds * 1000 : 0);
    do {
        if (pump) pump(this, user);
        if (Platform::WaitThread(m_Handle, kPumpMs)) return;
    } while (NowMs() <= deadline);
    KillScript();
}

void ScriptState::KillScript() {
    unsigned long long thread = m_ThreadID;
    if (!KillThread()) return;
    // It may have come to its end by itself: then all is whole, and at most a waiter is left.
    m_IsKilled = !m_HasEnded;
    m_HasEnded = true;
    m_ThreadID = 0;
    m_IsServing = false;
    m_Queue.Close();
    for (ScriptLanguage* language :
         {m_Language, g_LuaScriptLanguage, g_Py2ScriptLanguage, g_Py3ScriptLanguage}) {
        if (language && thread) language->ForgetThread(thread);
    }
    if (ScriptMessage* message = m_Current.exchange(nullptr)) {
        message->m_Result = SRES_Failed;
        if (message->GetType() == SMSG_Done && m_IsPooled) message->m_Result = SRES_Done;
        EndReturn(*message);
        message->m_IsAbandoned = m_IsKilled;
        if (message->m_ReplyEvent || !m_IsKilled) {
            message->Reply();
        } else {
            Abandon(message);
        }
    }
    RefuseRest();
}

// Printing, data, flags

void ScriptState::_SetPrintFuncs(PrintFunc print, PrintFunc error, void* userData, unsigned int) {
    m_Print = print;
    m_Error = error;
    m_PrintData = userData;
}

void ScriptState::_DoPrint(const char* text) {
    if (m_Print) return m_Print(m_PrintData, text);
    Platform::NoKill noKill;
    printf("%s", text ? text : "");
}

void ScriptState::_DoError(const char* text) {
    if (m_Error) return m_Error(m_PrintData, text);
    Platform::NoKill noKill;
    fputs(text ? text : "", stderr);
}

ScriptVal& ScriptState::_LockStateData() {
    m_StateData.Ensure(SV_Table);
    return m_StateData;
}

void ScriptState::_UnlockStateData() {
    if (RemoteApp* app = UseThisApp()) {
        g_RuntimeHooks.m_SetStateData(app, m_StateData);
        g_ScriptHooks.m_RecycleApp(app);
    }
}

// The connection with a use for the caller, or null.
RemoteApp* ScriptState::UseThisApp() const {
    AutoNestedSpinLock guard(m_RefLock);
    if (m_ThisApp) g_ScriptHooks.m_UseApp(m_ThisApp);
    return m_ThisApp;
}

void ScriptState::SetFlags(unsigned int bits) {
    if (!((m_Flags |= bits) & STF_Trace)) return;
    if (RemoteApp* app = UseThisApp()) {
        g_RuntimeHooks.m_SetAppTrace(app, true);
        g_ScriptHooks.m_RecycleApp(app);
    }
}

void ScriptState::ClearFlags(unsigned int bits) {
    bool trace = ((m_Flags &= ~bits) & STF_Trace) != 0;
    if (RemoteApp* app = UseThisApp()) {
        g_RuntimeHooks.m_SetAppTrace(app, trace);
        g_ScriptHooks.m_RecycleApp(app);
    }
}

// Debugging

// Calls look() with the state's lock held; false when there is no more lock to hold. A thread that
// is killed while it holds the lock never lets go of it, so this may not just wait, and a caller
// that is killed must not be the next one to keep it.
template <class Look>
bool ScriptState::LookLocked(Look&& look) {
    while (!m_IsKilled) {
        {
            Platform::NoKill noKill;
            if (m_StateLock.TryObtainLock()) {
                look();
                m_StateLock.ReleaseLock();
                return true;
            }
        }
        Platform::Wait(kPollMs);
    }
    return false;
}

bool ScriptState::IsDebug() {
    bool isDebug = false;
    LookLocked([&] { isDebug = _IsDebug(); });
    return isDebug;
}

bool ScriptState::IsDebugAvailable() {
    return m_Language->SupportsDebug() && !m_DebugObtained;
}

ScriptDebug* ScriptState::ObtainDebug() {
    return m_DebugObtained.exchange(true) ? nullptr : _GetDebug();
}

void ScriptState::ReleaseDebug(ScriptDebug*) {
    if (!LookLocked([&] { m_DebugObtained = false; })) m_DebugObtained = false;
}

void ScriptState::DebugHook(DebugHookData* data) {
    if (ScriptDebug* debug = m_Debug) debug->DebugHook(data);
}

// Clients and the state's thread may both be the first to ask.
ScriptDebug* ScriptState::_GetDebug() {
    ScriptDebug* debug = m_Debug;
    if (debug || !m_Language->SupportsDebug()) return debug;
    std::unique_ptr<ScriptDebug> made(m_Language->NewDebug(this));
    if (m_Debug.compare_exchange_strong(debug, made.get())) return made.release();
    return debug;
}

void ScriptState::_EnableDebug(bool enable) {
    if (!m_Language->SupportsDebug()) return;
    m_DebugEnabled = enable;
    ScriptDebug* debug = enable ? _GetDebug() : m_Debug.load();
    if (debug) debug->EnableDebug(enable);
}

}  // namespace Korvel::KorvelScript
