#include "Platform/Processes.h"

#include <strings.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>

#include "Platform/Mutex.h"
#include "Platform/NoKillInternal.h"
#include "core/0ReusePool.h"
#include "core/TextCellInternal.h"

namespace Korvel::Platform {
namespace {

// Made by whoever comes first, be it another static initialiser, and never deleted: threads may ask
// for a setting while the process ends.
_Mutex* EnvMutex() {
    static _Mutex* const s_EnvMutex = NewMutex(false);
    return s_EnvMutex;
}

// A text that was handed to putenv, which keeps the pointer. The chain is what owns them.
struct EnvString {
    EnvString* m_Next;
    char m_Text[];
};
constinit EnvString* s_EnvStrings = nullptr;  // guarded by the environment lock

class AutoEnvLock {
public:
    AutoEnvLock() { ObtainEnvLock(); }
    AutoEnvLock(const AutoEnvLock&) = delete;
    AutoEnvLock& operator=(const AutoEnvLock&) = delete;
    ~AutoEnvLock() { ReleaseEnvLock(); }

private:
    NoKill m_NoKill;
};

}  // namespace

char** GetEnviron() {
    return environ;
}
void ObtainEnvLock() {
    ObtainMutex(EnvMutex(), 0xFFFFFFFF);
}
void ReleaseEnvLock() {
    ReleaseMutex(EnvMutex());
}

bool GetEnv(const char* name, OxStringT<char>& value) {
    if (!name) return false;
    size_t length = strlen(name);
    AutoEnvLock lock;
    for (char** entry = environ; entry && *entry; entry++) {
        if (strncasecmp(*entry, name, length) != 0 || (*entry)[length] != '=') continue;
        const char* found = *entry + length + 1;
        if (TextCell::IsCell(found)) {
            value.Set("?", found + 1);
        } else {
            value.Set(found);
        }
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
    kept->m_Next = s_EnvStrings;
    s_EnvStrings = kept;
    return putenv(kept->m_Text) == 0;
}

}  // namespace Korvel::Platform
