// Numbers as text and back, with a point whatever the locale.
#pragma once

#include <cstddef>
#include <string_view>

namespace Korvel::TextForm {

// Reads all of a text as a number: decimal or hexadecimal, white space around it is free. Also what
// the C library knows as infinity and NaN.
bool ReadNumberText(std::string_view text, double& number);

inline constexpr size_t kNumberSize = 32;
// Writes a number as "%.14g" does; returns the length.
size_t WriteNumber(char* buffer, double number);

// The name of a chunk as messages give it, cut to a size: those of the lexer have more room.
inline constexpr size_t kChunkIdSize = 60;
inline constexpr size_t kSyntaxChunkIdSize = 80;
void GetChunkId(char* buffer, size_t size, const char* chunkName);

}  // namespace Korvel::TextForm
