#pragma once

#include <cstddef>
#include <string_view>

#include "core/ScriptVal.h"

namespace Korvel {

namespace TextForm {
class State;
struct Value;
}  // namespace TextForm

// Reads a value from text that came over the network, which no program may be trusted to have
// written: it gets no libraries, and only so much time and memory. False, with a nil, when it is no
// text of a value or takes too much. `err`, if given, takes the message.
bool FromForeignText(ScriptVal& out, const char* text, char* err, int errlen);

// Names with points between, none of them a keyword: what may stand in the text of a program.
bool IsIdentifierPath(std::string_view text);

// Whether such a path makes a constructor of that name in all readers. Not if they know its first
// name: a text would call what has it.
bool NamesConstructor(std::string_view path);

// What the readers are made of. `L` is a state of the private interpreter, whose errors are raised
// through native code as exceptions.

// Converts the value at a place of the stack, from the top for a negative one. False when memory
// runs out: a table then has what was read so far. What has no form as a value raises an error, and
// so does what nests too deeply. A limited interpreter pays for each entry, and its functions are
// read as nil. The last argument is not used.
bool _old_FromLua(TextForm::State& L, int index, ScriptVal& out, bool);

// Takes a part of a function's dump to a buffer that grows; 1 when there is no memory.
int mywriter(const void* data, size_t size, void* state);

// Makes the type of blocks, and its two constructors.
void register_memblock(TextForm::State& L);
// The bytes of a block; false for any other value.
bool GetTextMemBlock(TextForm::State& L, const TextForm::Value& value, MemBlock& block);

// Pushes the one userdata that stands for a pointer, of the type whose metatable has that name in
// the registry.
void lua_pushobject(TextForm::State& L, void* ptr, const char* typeName);

}  // namespace Korvel
