#pragma once

#include <cstdio>

#include "core/Export.h"

namespace Korvel::Platform {

// The C library's streams, positioned with 64 bits and closed in programs that this one executes.
// Paths are UTF-8. Null, with errno set, when the file cannot be opened or an argument is null; a
// descriptor that fdopen fails on remains the caller's.
KORVEL_EXPORT FILE* fopen(const char* path, const char* mode);
KORVEL_EXPORT FILE* fdopen(int fd, const char* mode);

}  // namespace Korvel::Platform
