// oxscript: runs Lua scripts with the libraries of korvelscript.
#include <getopt.h>

#include <cstdio>
#include <cstring>
#include <lua.hpp>

#include "runtime/lua/RunScript.h"

namespace {

constexpr int kUsageError = 2;

constexpr char kUsage[] = "Usage: oxscript FILE [ARGS...]\n";
constexpr char kHelp[] =
    "Runs a Lua script with the libraries of korvelscript.\n"
    "\n"
    "The script finds its arguments in the table 'arg': 'name=value' as arg.name, all others as\n"
    "arg[1] to arg[arg.n]. The libraries 'orv' and 'lpeg' are there without a require.\n"
    "\n"
    "  -h, --help     print this text and leave\n"
    "  -V, --version  print the version and leave\n"
    "\n"
    "The exit status is the number that the script returns or passes to os.exit, or 0; it is 255\n"
    "for a number outside 0 to 255 and for a script that fails, 2 for a wrong command line.\n";

// The number given to os.exit, once a script has called it.
bool s_HasExited = false;
double s_ExitCode = 0;

// os.exit ends a script with an empty error and a number in the global _EXITCODE. On its way
// through a coroutine or another `error` the empty message may have got a position in front.
bool TakeExit(lua_State* L) {
    if (lua_type(L, 1) != LUA_TSTRING) return false;
    size_t length;
    const char* message = lua_tolstring(L, 1, &length);
    if (length && (length < 2 || strcmp(message + length - 2, ": ") != 0)) return false;
    lua_pushliteral(L, "_EXITCODE");
    lua_rawget(L, LUA_GLOBALSINDEX);
    s_HasExited = lua_type(L, -1) == LUA_TNUMBER;
    s_ExitCode = lua_tonumber(L, -1);
    lua_pop(L, 1);
    return s_HasExited;
}

// The message handler: writes the message and where it came from. An error value that is no text is
// shown as its __tostring tells, or by its type.
int ReportError(lua_State* L) {
    if (TakeExit(L)) return 0;
    if (lua_type(L, 1) != LUA_TSTRING && !luaL_callmeta(L, 1, "__tostring")) {
        lua_pushfstring(L, "(error object is a %s value)", luaL_typename(L, 1));
    }
    // Level 0 is this function, and a file that could not be loaded has one caller more: ourselves.
    lua_Debug caller;
    if (lua_getstack(L, 2, &caller)) {
        const char* message = lua_tostring(L, -1);
        luaL_traceback(L, L, message ? message : "(error object has no text)", 1);
    }
    size_t length;
    const char* text = lua_tolstring(L, -1, &length);
    fputs("oxscript: ", stderr);
    fwrite(text, 1, length, stderr);
    fputc('\n', stderr);
    return 0;
}

int ToStatus(double result) {
    return result >= 0 && result <= 255 ? static_cast<int>(result) : 255;
}

}  // namespace

int main(int argc, char** argv) {
    static const option kOptions[] = {
        {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, 'V'},
        {nullptr, 0, nullptr, 0},
    };
    // The '+' ends the options at the file: what follows belongs to the script.
    for (int found; (found = getopt_long(argc, argv, "+hV", kOptions, nullptr)) != -1;) {
        switch (found) {
            case 'h':
                printf("%s%s", kUsage, kHelp);
                return 0;
            case 'V':
                printf("oxscript %s (%s)\n", OXSCRIPT_VERSION, LUAJIT_VERSION);
                return 0;
            default:
                fputs(kUsage, stderr);
                return kUsageError;
        }
    }
    if (optind >= argc) {
        fprintf(stderr, "oxscript: no script file given\n%s", kUsage);
        return kUsageError;
    }
    int result = Korvel::RunScriptWith(argv[optind], argv + optind + 1, ReportError);
    return ToStatus(s_HasExited ? s_ExitCode : result);
}
