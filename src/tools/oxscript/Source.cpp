#include "tools/oxscript/Source.h"

#include <lua.hpp>
#include <memory>

#include "Platform/Strings.h"

namespace Korvel::Oxscript {
namespace {

struct CloseLua {
    void operator()(lua_State* L) const { lua_close(L); }
};

enum class Parse { Good, Unfinished, Wrong };

Parse Compile(lua_State* L, const std::string& text) {
    int status = luaL_loadbuffer(L, text.data(), text.size(), "=");
    const char* message = status == 0 ? "" : lua_tostring(L, -1);
    bool isUnfinished = std::string_view(message ? message : "").ends_with("'<eof>'");
    lua_settop(L, 0);
    if (status == 0) return Parse::Good;
    return isUnfinished ? Parse::Unfinished : Parse::Wrong;
}

}  // namespace

bool ReadAll(FILE* file, std::string& text) {
    char block[16384];
    while (size_t count = fread(block, 1, sizeof(block), file)) text.append(block, count);
    return !ferror(file);
}

int FindBadLine(const std::string& text) {
    if (text.starts_with(LUA_SIGNATURE[0])) return 1;
    int number = 1;
    for (size_t start = 0; start < text.size(); number++) {
        size_t end = std::min(text.find('\n', start), text.size());
        std::string line = text.substr(start, end - start);
        if (line.find('\0') != line.npos || !Platform::IsUTF8(line.c_str())) return number;
        start = end + 1;
    }
    return 0;
}

Input Classify(const std::string& text) {
    std::unique_ptr<lua_State, CloseLua> scratch(luaL_newstate());
    if (!scratch) return Input::Statement;
    Parse asValue = Compile(scratch.get(), "return " + text + "\n");
    // "f();" can be returned, but is no list of arguments.
    if (asValue == Parse::Good &&
        Compile(scratch.get(), ToProgram(text, Input::Expression)) == Parse::Good) {
        return Input::Expression;
    }
    Parse asStatement = Compile(scratch.get(), ToProgram(text, Input::Statement));
    if (asStatement == Parse::Good) return Input::Statement;
    bool isUnfinished = asValue == Parse::Unfinished || asStatement == Parse::Unfinished;
    return isUnfinished ? Input::Unfinished : Input::Statement;
}

std::string ToProgram(const std::string& text, Input input) {
    // The space keeps a '#' or an escape character from being the first of the program.
    if (input != Input::Expression) return " " + text;
    // A line end closes a comment. Elsewhere it would spoil the numbers of lines.
    const char* end = text.find("--") != text.npos ? "\n)" : ")";
    return "(function(...) if select('#', ...) > 0 then print(...) end end)(" + text + end;
}

}  // namespace Korvel::Oxscript
