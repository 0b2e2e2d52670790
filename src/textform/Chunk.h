// Precompiled chunks: a header of 12 bytes, and the functions with their debug information.
#pragma once

#include "textform/State.h"

namespace Korvel::TextForm {

class Source;

inline constexpr int kBinaryMark = 0x1B;  // the first byte of a binary chunk

// The mark, version 5.1, format 0, little-endian, and the sizes of int, size_t, instructions and
// numbers, which are not whole.
inline constexpr unsigned char kChunkHeader[12] = {kBinaryMark, 'L', 'u', 'a', 0x51, 0,
                                                   1,           4,   8,   4,   8,    0};

// Reads a chunk and checks its code. Raises an error for anything that is not safe to run.
Prototype* Undump(State& L, Source& source, const char* chunkName);

// Whether no run of the code can leave the function's stack, constants and instructions.
bool CheckCode(const Prototype* prototype);

// Takes a part of a dump; a result other than 0 ends the writing.
using ChunkWriter = int (*)(const void* data, size_t size, void* state);

// Writes a function with its header. Returns what the writer returned last.
int Dump(const Prototype* prototype, ChunkWriter writer, void* writerState);

}  // namespace Korvel::TextForm
