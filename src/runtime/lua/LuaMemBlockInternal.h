#pragma once

#include "core/MemBlock.h"

struct lua_State;

namespace Korvel {

// Blocks of bytes in Lua. A block is a userdata whose metatable is "MemBlock" of the registry and
// that holds a pointer to a record. It owns the record and the bytes, both blocks of the pool. The
// pointer is null where there was no memory and after __gc, which a script can call too.

// A record and a copy of the bytes, both blocks of the pool and the caller's; zeros where their
// pointer is null. Null without memory.
MemBlock* NewMemBlock(const MemBlock& bytes);

// Pushes a copy of the bytes; zeros where their pointer is null. False, with nothing pushed, when
// there is no memory for them. Raises Lua errors and may collect garbage.
bool PushMemBlock(lua_State* L, const MemBlock& bytes);

// The block at an index from the bottom of the stack, borrowed from its userdata; null for anything
// else.
MemBlock* ToMemBlock(lua_State* L, int index);

}  // namespace Korvel
