#include "Platform/Processes.h"

#include <signal.h>
#include <strings.h>
#include <sys/random.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <type_traits>

#include "Platform/Events.h"
#include "Platform/MutexInternal.h"
#include "Platform/NoKillInternal.h"
#include "core/0ReusePool.h"
#include "core/TextCellInternal.h"

namespace Korvel::Platform {
namespace {

// Constant-initialised and with nothing to destroy: other static initialisers, and threads that
// still run while the process ends, may ask for a setting.
constinit _Mutex s_EnvMutex;
static_assert(std::is_trivially_destructible_v<_Mutex>);

// A text that was handed to putenv, which keeps the pointer. The chain is what owns them.
struct EnvString {
    EnvString* m_Next;
    char m_Text[];
};
constinit EnvString* s_EnvStrings = nullptr;  // guarded by the environment lock

// Holds the environment lock until the end of its scope, and keeps kills away meanwhile.
class AutoEnvLock {
public:
    AutoEnvLock() { ObtainMutexGuarded(s_EnvMutex, kNoTimeLimit); }
    AutoEnvLock(const AutoEnvLock&) = delete;
    AutoEnvLock& operator=(const AutoEnvLock&) = delete;
    ~AutoEnvLock() { ReleaseEnvLock(); }

private:
    NoKill m_NoKill;
};

}  // namespace

void InitProcess() {
    constexpr rlim_t kWantedFiles = 10000;
    rlimit files;
    if (getrlimit(RLIMIT_NOFILE, &files) == 0) {
        files.rlim_cur = std::min(std::max(files.rlim_cur, kWantedFiles), files.rlim_max);
        setrlimit(RLIMIT_NOFILE, &files);
    }
    signal(SIGPIPE, SIG_IGN);
    umask(0);
}

char** GetEnviron() {
    return environ;
}
void ObtainEnvLock() {
    ObtainMutex(&s_EnvMutex, kNoTimeLimit);
}
void ReleaseEnvLock() {
    ReleaseMutex(&s_EnvMutex);
}

bool GetEnv(const char* name, OxStringT<char>& value) {
    if (!name) return false;
    size_t length = strlen(name);
    AutoEnvLock lock;
    for (char** entry = environ; entry && *entry; entry++) {
        if (strncasecmp(*entry, name, length) != 0 || (*entry)[length] != '=') continue;
        const char* found = *entry + length + 1;
        OxStringT<char> copy;
        if (TextCell::IsCell(found)) {
            copy.Set("?", found + 1);
        } else {
            copy.Set(found);
        }
        if (*found && copy.IsEmpty()) return false;
        value = std::move(copy);
        return true;
    }
    return false;
}

bool PutEnv(const char* setting) {
    if (!setting || !*setting) return false;
    size_t size = strlen(setting) + 1;
    AutoEnvLock lock;
    EnvString* kept = static_cast<EnvString*>(g_ReusePoolMgr.Alloc(sizeof(EnvString) + size));
    if (!kept) return false;
    memcpy(kept->m_Text, setting, size);
    bool isDone = putenv(kept->m_Text) == 0;
    if (isDone && strchr(setting, '=')) {
        kept->m_Next = s_EnvStrings;
        s_EnvStrings = kept;
    } else {  // a variable was taken out, or nothing happened
        g_ReusePoolMgr.Free(kept);
    }
    return isDone;
}

char* NewUUID() {
    constexpr size_t kBlockSize = 40;
    uint8_t bytes[16];
    ssize_t got;
    do {
        got = getrandom(bytes, sizeof(bytes), 0);
    } while (got < 0 && errno == EINTR);
    if (got != sizeof(bytes)) return nullptr;
    bytes[6] = static_cast<uint8_t>((bytes[6] & 0x0F) | 0x40);  // version 4: random
    bytes[8] = static_cast<uint8_t>((bytes[8] & 0x3F) | 0x80);  // the usual variant
    char* uuid = static_cast<char*>(malloc(kBlockSize));
    if (!uuid) return nullptr;
    char* out = uuid;
    for (int i = 0; i < 16; i++) {
        if (i == 4 || i == 6 || i == 8 || i == 10) *out++ = '-';
        *out++ = "0123456789abcdef"[bytes[i] >> 4];
        *out++ = "0123456789abcdef"[bytes[i] & 15];
    }
    *out = 0;
    return uuid;
}

void DeleteUUID(char* uuid) {
    free(uuid);
}

}  // namespace Korvel::Platform
