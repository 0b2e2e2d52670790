#pragma once

#include <cstdio>
#include <string>

// The texts that the tool runs, before a state sees them.
namespace Korvel::Oxscript {

// All that can still be read. False, with errno set, when reading fails.
bool ReadAll(FILE* file, std::string& text);

// The number of the first line that is not UTF-8 text or holds a NUL or an escape character in
// front, which would make it a compiled script; 0 when all lines are good.
int FindBadLine(const std::string& text);

// What somebody has typed so far.
enum class Input { Expression, Statement, Unfinished };

// Tells by compiling it, without running anything. Input that can't be compiled at all counts as a
// statement: running it shows the error.
Input Classify(const std::string& text);

// What to run for an input: the text, or for an expression one that prints its values, if any. The
// lines keep their numbers.
std::string ToProgram(const std::string& text, Input input);

}  // namespace Korvel::Oxscript
