// The tests' wrapper around the C heap: with -Wl,--wrap=malloc and its like, the library's own
// calls come here, and count and fail as those of the pools do.
#include <cstddef>

#include "core/FaultsInternal.h"

extern "C" {

void* __real_malloc(size_t size);
void* __real_calloc(size_t count, size_t size);
void* __real_realloc(void* p, size_t size);

void* __wrap_malloc(size_t size);
void* __wrap_calloc(size_t count, size_t size);
void* __wrap_realloc(void* p, size_t size);

void* __wrap_malloc(size_t size) {
    return Korvel::Faults::ShouldFail() ? nullptr : __real_malloc(size);
}

void* __wrap_calloc(size_t count, size_t size) {
    return Korvel::Faults::ShouldFail() ? nullptr : __real_calloc(count, size);
}

void* __wrap_realloc(void* p, size_t size) {
    return Korvel::Faults::ShouldFail() ? nullptr : __real_realloc(p, size);
}

}  // extern "C"
