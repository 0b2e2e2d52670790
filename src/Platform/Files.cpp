#include "Platform/Files.h"

#include <fcntl.h>

#include <cerrno>
#include <cstring>

namespace Korvel::Platform {

static_assert(sizeof(off_t) == 8);

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

}  // namespace Korvel::Platform
