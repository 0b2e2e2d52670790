#pragma once

#include <cstddef>
#include <cstdint>

namespace Korvel {

// Four bytes that are equal for equal texts and differ for most others: the length, the first byte,
// the last and the one between. A search among a few names compares them before it looks at a text;
// they cost much less than a hash. 0 for an empty text.
inline uint32_t GetTextProbe(const char* text, size_t length) {
    if (length == 0) return 0;
    auto byte = [text](size_t i) { return uint32_t{static_cast<unsigned char>(text[i])}; };
    return (length & 0xff) | byte(0) << 8 | byte(length / 2) << 16 | byte(length - 1) << 24;
}

}  // namespace Korvel
