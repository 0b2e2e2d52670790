#pragma once

// Marks what the shared library shows to its hosts; everything else is hidden.
#define KORVEL_EXPORT __attribute__((visibility("default")))

// For operations that take a printf format: `text` and `first` are the numbers of the parameters
// with the format and with the first argument, counted from 1. A member's own object is parameter
// 1, and `first` is 0 where the arguments come as a va_list.
#define KORVEL_PRINTF(text, first) __attribute__((format(printf, text, first)))

namespace Korvel {

// True for a null object. The few operations that may be called on a null `this` ask here; the
// build's -fno-delete-null-pointer-checks keeps compilers from dropping the question.
inline bool IsNull(const void* object) {
    return object == nullptr;
}

}  // namespace Korvel
