#include "Platform/Files.h"

#include <dlfcn.h>
#include <fcntl.h>
#include <limits.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

namespace Korvel::Platform {
namespace {

static_assert(sizeof(off_t) == 8);
static_assert(kMaxPath >= PATH_MAX);

// Found while the library is loaded, for the loader may know it by a path that is relative to the
// directory of that time.
struct LibraryFolder {
    LibraryFolder() {
        Dl_info library;
        if (!dladdr(this, &library) || !realpath(library.dli_fname, m_Path)) return;
        m_Length = strrchr(m_Path, '/') + 1 - m_Path;
    }

    long m_Length = 0;
    char m_Path[kMaxPath];
};
const LibraryFolder s_LibraryFolder;

}  // namespace

FILE* fopen(const char* path, const char* mode) {
    constexpr size_t kMaxMode = 30;
    size_t length = mode ? strlen(mode) : 0;
    if (!path || length == 0 || length > kMaxMode) {
        errno = EINVAL;
        return nullptr;
    }
    // Behind the first letter, for a mode may end in the name of an encoding.
    char withCloseOnExec[kMaxMode + 2] = {mode[0], 'e'};
    memcpy(withCloseOnExec + 2, mode + 1, length);
    return ::fopen(path, withCloseOnExec);
}

FILE* fdopen(int fd, const char* mode) {
    if (!mode) {
        errno = EINVAL;
        return nullptr;
    }
    FILE* file = ::fdopen(fd, mode);
    if (file) fcntl(fd, F_SETFD, FD_CLOEXEC);
    return file;
}

bool GetAppFileName(char* buf, int size) {
    if (!buf || size <= 0) return false;
    ssize_t length = readlink("/proc/self/exe", buf, static_cast<size_t>(size));
    if (length <= 0 || length == size) return false;
    buf[length] = 0;
    return true;
}

int GetSystemFolder(SysFolder folder, char* buf, int size) {
    if (!buf) return kMaxPath;
    if (folder == SF_Program) {
        if (!GetAppFileName(buf, size)) return 0;
        strrchr(buf, '/')[1] = 0;
        return kMaxPath;
    }
    long length = folder == SF_Library ? s_LibraryFolder.m_Length : 0;
    if (length == 0 || length >= size) return 0;
    memcpy(buf, s_LibraryFolder.m_Path, static_cast<size_t>(length));
    buf[length] = 0;
    return kMaxPath;
}

}  // namespace Korvel::Platform
