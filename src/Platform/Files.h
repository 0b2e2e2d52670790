#pragma once

#include <cstdio>

#include "core/Export.h"

namespace Korvel::Platform {

// The C library's streams, positioned with 64 bits and closed in programs that this one executes.
// Paths are UTF-8. Null, with errno set, when the file cannot be opened or an argument is null; a
// descriptor that fdopen fails on remains the caller's.
KORVEL_EXPORT FILE* fopen(const char* path, const char* mode);
KORVEL_EXPORT FILE* fdopen(int fd, const char* mode);

// Folders that GetSystemFolder knows.
enum SysFolder : unsigned int {
    SF_Library = 0,   // that holds this library
    SF_Program = 10,  // that holds the program which runs
};

constexpr int kMaxPath = 4096;  // bytes of a path, its end included

// Writes a folder's path, with a slash behind it, to `buf`, which has room for `size` bytes.
//   returns  kMaxPath, also for a null `buf`; 0 when the folder is not known or `size` too small
KORVEL_EXPORT int GetSystemFolder(SysFolder folder, char* buf, int size);

// The path of the program that runs. False when it is not known or `size` too small.
KORVEL_EXPORT bool GetAppFileName(char* buf, int size);

}  // namespace Korvel::Platform
