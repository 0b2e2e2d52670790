#include "diag/Debug.h"

#include <strings.h>
#include <unistd.h>

#include <cstdarg>
#include <cstdlib>
#include <ctime>
#include <new>

#include "Platform/LocaleInternal.h"
#include "Platform/NoKillInternal.h"
#include "Platform/Processes.h"
#include "Platform/Threads.h"
#include "Platform/Time.h"

namespace Korvel {
namespace {

void PrintHeader(FILE* stream) {
    char text[64];
    time_t now = time(nullptr);
    tm local = {};
    localtime_r(&now, &local);
    strftime_l(text, sizeof(text), "%d/%b/%y %H:%M:%S", &local, Platform::CLocale());
    fprintf(stream, "\n\n-------- %s --------\n%s\n", text, "???");
    fflush(stream);
}

// The log has no destructor that runs, since others may print into it at exit. Until its
// constructor has run it is all zeros, and so without a stream.
union ImmortalLog {
    constexpr ImmortalLog() : m_None() {}
    ~ImmortalLog() {}

    char m_None;
    DebugLog m_Log;
};
constinit ImmortalLog s_ScriptServerLog;

struct ScriptServerLogOpener {
    ScriptServerLogOpener() {
        new (&s_ScriptServerLog.m_Log)
            DebugLog("OXSCRIPT_LOG_SERVER", "C:\\KorvelScriptServer", false);
    }
};
const ScriptServerLogOpener s_Opener;

}  // namespace

constinit DebugLog& g_ScriptServerLog = s_ScriptServerLog.m_Log;

DebugLog::DebugLog(const char* envName, const char* baseName, bool defaultOn)
    : m_Stream(nullptr), m_EnvName(envName), m_FileName{}, m_DefaultOn(defaultOn) {
    if (!baseName) return;
    int length = snprintf(m_FileName, sizeof(m_FileName), "%s_%d.log", baseName, getpid());
    if (length < 0 || length >= Platform::kMaxPath || !IsSwitchedOn()) return;
    m_Stream = Platform::fopen(m_FileName, "a");
    if (m_Stream) PrintHeader(m_Stream);
}

bool DebugLog::IsSwitchedOn() const {
    Platform::NoKill noKill;
    Platform::ObtainEnvLock();
    const char* value = m_EnvName ? getenv(m_EnvName) : nullptr;
    bool isOn = value ? strcasecmp(value, "true") == 0 : m_DefaultOn;
    Platform::ReleaseEnvLock();
    return isOn;
}

DebugLog::~DebugLog() {
    if (m_Stream) fclose(m_Stream);
}

void DebugLog::PrintF(const char* format, ...) {
    if (!m_Stream || !format) return;
    Platform::NoKill noKill;  // outside of the lock: a killed thread would hold it for ever
    KorvelScript::AutoLock lock(*this);
    fprintf(m_Stream, "%d [% 5d] ", static_cast<int>(Platform::GetUpTime()),
            static_cast<int>(Platform::GetCurrentThreadID()));
    va_list arguments;
    va_start(arguments, format);
    vfprintf(m_Stream, format, arguments);
    va_end(arguments);
    fflush(m_Stream);
}

}  // namespace Korvel
