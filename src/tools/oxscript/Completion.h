#pragma once

#include <string>
#include <string_view>
#include <vector>

namespace Korvel::Oxscript {

class Runner;

// How a name that is being typed can go on.
struct Completions {
    size_t m_Typed = 0;                // bytes of the name that stand there already
    std::vector<std::string> m_Names;  // whole names, in order
};

// For the end of a text: globals and keywords, or behind "a.b." and "a.b:" the fields of a table
// and of the tables that its metatable looks them up in. Functions of metatables are not called,
// but an object of an application is asked for its members; behind ":" only for its functions.
Completions Complete(Runner& runner, std::string_view text);

}  // namespace Korvel::Oxscript
