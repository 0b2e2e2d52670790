#include "tools/oxscript/Runner.h"

#include <pthread.h>
#include <semaphore.h>
#include <signal.h>
#include <stdio_ext.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <lua.hpp>

#include "remote/RemoteApp.h"
#include "tools/oxscript/Application.h"

namespace Korvel::Oxscript {
namespace {

using namespace KorvelScript;

constexpr int kFailedStatus = 255;
constexpr int kPatienceSeconds = 2;  // that a script has to stop after the first Ctrl-C
constexpr double kAnswerSeconds = 1;

// For the handler of SIGINT, and for the end of a run
sem_t s_Wake;                                    // the main thread has something to look at
std::atomic<int> s_Interrupts{0};                // since the run began
std::atomic<lua_State*> s_Interpreter{nullptr};  // while it runs something

static_assert(std::atomic<lua_State*>::is_always_lock_free);

// The hook that stops a script. It goes off once.
void StopScript(lua_State* L, lua_Debug*) {
    lua_sethook(L, nullptr, 0, 0);
    luaL_error(L, "interrupted!");
}

// Comes on the state's thread, for the main thread blocks the signal.
void OnInterrupt(int) {
    int error = errno;
    s_Interrupts++;
    if (lua_State* L = s_Interpreter) {
        lua_sethook(L, StopScript, LUA_MASKCALL | LUA_MASKRET | LUA_MASKCOUNT, 1);
    }
    sem_post(&s_Wake);
    errno = error;
}

// Without SA_RESTART, so that a script that waits for input is woken.
void SetInterruptHandler(void (*handler)(int)) {
    struct sigaction action = {};
    action.sa_handler = handler;
    sigaction(SIGINT, &action, nullptr);
}

void MaskInterrupt(int how) {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, SIGINT);
    pthread_sigmask(how, &set, nullptr);
}

// What a run has come to.
struct Outcome {
    std::atomic<bool> m_HasEnded{false};
    unsigned int m_Result = SRES_Failed;
};

// Tells its end to the main thread, in whatever way it ends.
class RunMessage : public ScriptMessage {
public:
    RunMessage(eScriptMessage type, Outcome& outcome) : ScriptMessage(type), m_Outcome(outcome) {
        m_Result = SRES_Failed;
    }
    // On the state's thread, or on the main thread when the state has not taken it.
    ~RunMessage() override {
        // From here on the handler leaves the interpreter alone.
        lua_State* L = s_Interpreter.exchange(nullptr);
        if (L && lua_gethook(L) == StopScript) lua_sethook(L, nullptr, 0, 0);
        m_Outcome.m_Result = m_Result;
        m_Outcome.m_HasEnded = true;
        sem_post(&s_Wake);
    }

private:
    Outcome& m_Outcome;
};

timespec Now() {
    timespec now;
    clock_gettime(CLOCK_MONOTONIC, &now);
    return now;
}

bool IsBefore(const timespec& a, const timespec& b) {
    return a.tv_sec != b.tv_sec ? a.tv_sec < b.tv_sec : a.tv_nsec < b.tv_nsec;
}

// Straight to the descriptor: a thread that is killed in here leaves no lock behind.
void WriteError(const char* text) {
    while (*text) {
        ssize_t count = write(STDERR_FILENO, text, strlen(text));
        if (count > 0) {
            text += count;
        } else if (errno != EINTR) {
            return;
        }
    }
}

// Waits for the end of a run; false when the user gives it up.
bool Await(const Outcome& outcome) {
    int seen = 0;
    bool isWarned = false;
    timespec limit = {};
    while (true) {
        if (seen && !isWarned) {
            sem_clockwait(&s_Wake, CLOCK_MONOTONIC, &limit);
        } else {
            sem_wait(&s_Wake);
        }
        if (outcome.m_HasEnded) return true;
        int count = s_Interrupts;
        if (count && !seen) {
            limit = Now();
            limit.tv_sec += kPatienceSeconds;
        } else if (seen && !isWarned && !IsBefore(Now(), limit)) {
            isWarned = true;
            WriteError(
                "The script does not stop. Ctrl-C again ends it by force, and all that has "
                "been defined is lost.\n");
        } else if (isWarned && count > seen) {
            return false;
        }
        seen = count;
    }
}

// Tells what error values that are no texts are, before the state reports them.
constexpr char kDescribeErrors[] = R"lua(
local alert = _ALERT
function _ALERT(value)
    if type(value) ~= "string" then
        local meta = debug.getmetatable(value)
        local isShown = type(value) == "number" or meta and meta.__tostring
        value = isShown and tostring(value) or "(error object is a " .. type(value) .. " value)"
    end
    alert(value)
end
)lua";

// A text in Lua, whatever bytes it has.
std::string Quote(const std::string& text) {
    std::string quoted = "\"";
    for (unsigned char byte : text) {
        char escape[8];
        snprintf(escape, sizeof(escape), "\\%03u", byte);
        quoted += escape;
    }
    return quoted + "\"";
}

}  // namespace

Runner::Runner(ScriptLanguage* language, std::vector<std::string> args, const Application& app,
               const char* prefix, bool isInteractive)
    : m_Language(language),
      m_Args(std::move(args)),
      m_App(app),
      m_Prefix(prefix),
      m_IsInteractive(isInteractive) {
    sem_init(&s_Wake, 0, 0);
    if (isInteractive) SetInterruptHandler(OnInterrupt);
    Start();
}

Runner::~Runner() {
    // Finalisers that run now can be stopped by SIGINT, but only together with the tool.
    if (m_IsInteractive) SetInterruptHandler(SIG_DFL);
    MaskInterrupt(SIG_UNBLOCK);
    if (m_State) m_State->Recycle();
    sem_destroy(&s_Wake);
}

void Runner::Start() {
    // The state's thread inherits the mask.
    MaskInterrupt(SIG_UNBLOCK);
    m_State = m_Language->NewState(nullptr, STF_Announce);
    MaskInterrupt(SIG_BLOCK);
    if (!m_State) return;
    m_State->SetPrintFuncs(nullptr, OnError, this);
    m_State->Execute(kDescribeErrors, 0, "=oxscript");
    SetArgs();
    if (!m_App.m_Object.IsNil()) m_State->SetGlobal("app", m_App.m_Object);
    if (!m_App.m_Startup.IsNil()) m_State->SetGlobal("startup", m_App.m_Startup);
    // What a file finds as `globals` is at a prompt the same as _G.
    if (m_IsInteractive) m_State->Execute("jit.off() globals = _G", 0, "=oxscript");
}

// The script comes second, for a '=' in its name would make it a named argument.
void Runner::SetArgs() {
    char none[] = "";
    std::vector<char*> argv = {none};
    for (size_t i = 1; i < m_Args.size(); i++) argv.push_back(m_Args[i].data());
    argv.push_back(nullptr);
    m_State->SetArgs(argv.data(), static_cast<int>(argv.size() - 1));
    m_State->Execute(("arg[0] = " + Quote(m_Args[0])).c_str(), 0, "=oxscript");
}

void Runner::StartAfresh() {
    m_State->Shutdown(0, nullptr, nullptr);
    m_State->Recycle();
    m_State = nullptr;
    // The thread may have been in the middle of an output, and then holds its stream for ever.
    for (FILE* stream : {stdin, stdout, stderr}) __fsetlocking(stream, FSETLOCKING_BYCALLER);
    Start();
    WriteError(m_State ? "The script has been ended. This is a fresh state.\n"
                       : "The script has been ended. There is no memory for a fresh state.\n");
}

bool Runner::RunFile(const std::string& file) {
    // A text that begins with this byte is not taken for one.
    return Run(SMSG_ExecuteFile, file.starts_with('\xFF') ? "./" + file : file, nullptr);
}

bool Runner::RunText(const std::string& text, const char* name) {
    return Run(SMSG_Execute, text, name);
}

bool Runner::Run(eScriptMessage type, const std::string& what, const char* name) {
    m_HasExited = false;
    m_Status = kFailedStatus;
    s_Interrupts = 0;
    while (sem_trywait(&s_Wake) == 0) continue;

    Outcome outcome;
    ScriptMessage* message = new RunMessage(type, outcome);
    if (!message) {
        OnError(this, "not enough memory");
        OnError(this, "\n");
        return false;
    }
    message->m_Name.Set(what.c_str(), true);
    message->m_Name2.Set(name, true);
    if (m_IsInteractive) s_Interpreter = static_cast<lua_State*>(m_State->GetRawState());
    m_State->DoMessage(message, SEXEC_NoWait, true);
    if (!Await(outcome)) {
        s_Interpreter = nullptr;
        StartAfresh();
        return false;
    }
    fflush(stdout);
    m_Status = TakeStatus(outcome.m_Result);
    ShowPendingErrors();
    TellIfApplicationHasGone();
    return outcome.m_Result == SRES_Done;
}

int Runner::TakeStatus(unsigned int result) {
    ScriptVal status = m_State->GetRunResult();
    if (result != SRES_Done) {
        if (!m_HasExited) {
            const OxStringT<char>& traceback = m_State->GetTraceback();
            if (!traceback.IsEmpty()) WriteError((std::string(traceback) + "\n").c_str());
            return kFailedStatus;
        }
        m_State->GetGlobal("_EXITCODE", status);
    } else {
        m_HasExited = false;
    }
    double number = status.ToNumber(0);
    return number >= 0 && number <= 255 ? static_cast<int>(number) : kFailedStatus;
}

std::string Runner::Ask(const std::string& text) {
    std::string answer;
    RemoteApp* app = m_App.m_Object.GetApp();
    double timeOut = app ? app->SetTimeOut(kAnswerSeconds) : 0;
    m_State->SetPrintFuncs(OnAnswer, OnAnswer, &answer);
    unsigned int result = m_State->Execute(text.c_str(), 0, "=oxscript");
    m_State->SetPrintFuncs(nullptr, OnError, this);
    if (app) {
        app->SetTimeOut(timeOut);
        TakePendingErrors();  // those of the question are nobody's
    }
    return result == SRES_Done ? answer : std::string();
}

void Runner::OnAnswer(void* answer, const char* text) {
    *static_cast<std::string*>(answer) += text;
}

void Runner::OnError(void* self, const char* text) {
    static_cast<Runner*>(self)->ShowError(text ? text : "");
}

// A message comes in pieces, of which the last is a line end.
void Runner::ShowError(const char* text) {
    if (m_IsLineStart) {
        m_HasExited = IsExit(text);
        if (m_Prefix && !m_HasExited) WriteError(m_Prefix);
    }
    if (!m_HasExited) WriteError(text);
    m_IsLineStart = strcmp(text, "\n") == 0;
}

void Runner::ShowPendingErrors() {
    std::string lines = TakePendingErrors();
    for (size_t start = 0, end; (end = lines.find('\n', start)) != lines.npos; start = end + 1) {
        WriteError(std::string(m_Prefix).append(lines, start, end + 1 - start).c_str());
    }
}

// Once. It may be why a script has failed, or has got nothing but nil.
void Runner::TellIfApplicationHasGone() {
    RemoteApp* app = m_App.m_Object.GetApp();
    if (!app || app->Connected() || std::exchange(m_HasToldOfEnd, true)) return;
    WriteError(std::string(m_Prefix).append(app->GetName()).append(" has gone.\n").c_str());
}

// os.exit ends a script with an empty error and a number in the global _EXITCODE. On its way
// through a coroutine or another `error` the empty message may have got a position in front.
bool Runner::IsExit(const char* text) {
    std::string_view message = text;
    return (message.empty() || message.ends_with(": ")) &&
           m_State->GetGlobalType("_EXITCODE") == SV_Number;
}

}  // namespace Korvel::Oxscript
