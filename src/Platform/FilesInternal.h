#pragma once

#include <cstdint>
#include <memory>

#include "Platform/Files.h"

namespace Korvel::Platform {

struct CloseFile {
    void operator()(FILE* file) const { fclose(file); }
};
using File = std::unique_ptr<FILE, CloseFile>;

// The size of a file, at whose end it then stands; -1 when that cannot be told.
inline int64_t SizeOf(FILE* file) {
    return fseeko(file, 0, SEEK_END) == 0 ? ftello(file) : -1;
}

}  // namespace Korvel::Platform
