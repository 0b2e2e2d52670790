// oxscript: runs scripts on a state of korvelscript, or what somebody types at its prompt.
#include <getopt.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <lua.hpp>

#include "Platform/Files.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"
#include "tools/oxscript/Application.h"
#include "tools/oxscript/Prompt.h"
#include "tools/oxscript/Runner.h"
#include "tools/oxscript/Source.h"

namespace Korvel::Oxscript {
namespace {

using KorvelScript::ScriptLanguage;

enum : int { kFailure = 255, kUsageError = 2 };

constexpr char kPrefix[] = "oxscript: ";
constexpr char kUsage[] = "Usage: oxscript [OPTIONS] FILE [ARGS...]\n";
constexpr char kHelp[] =
    "Runs a script with the libraries of korvelscript. FILE may be - for standard input. With no\n"
    "FILE it opens a prompt on a terminal, and runs what other standard input holds.\n"
    "\n"
    "The script finds its arguments in the table 'arg': 'name=value' as arg.name, all others as\n"
    "arg[1] to arg[arg.n]. The libraries 'orv' and 'lpeg' are there without a require.\n"
    "\n"
    "  -a PORT        work on the application that listens at a port of this machine, such as\n"
    "                 it has printed: it is the global 'app'\n"
    "  -e TEXT        run a text, before FILE if there is one\n"
    "  -i             open the prompt afterwards; it sees the globals of FILE\n"
    "  -l LANGUAGE    lua, python, python2 or python3, where the name of FILE does not tell\n"
    "  -q             no banner at the prompt, and no 'oxscript:' in front of errors\n"
    "  -h, --help     print this text and leave\n"
    "  -V, --version  print the version and leave\n"
    "\n"
    "At the prompt an expression shows its values, Tab completes names, Ctrl-C stops what runs or\n"
    "drops what has been typed, and Ctrl-D leaves. The compiler is off there, so that Ctrl-C\n"
    "works everywhere; jit.on() turns it on.\n"
    "\n"
    "An error of the application that a script has not asked for (app.LastError) is shown when it\n"
    "ends, at the prompt after each line, and is gone from LastError then.\n"
    "\n"
    "The exit status is the number that the script returns or passes to os.exit, or 0; it is 255\n"
    "for a number outside 0 to 255 and for a script that fails, 2 for a wrong command line.\n";

struct Options {
    const char* m_Port = nullptr;  // of the application
    std::vector<std::string> m_Texts;
    const char* m_Language = nullptr;
    bool m_IsQuiet = false;
    bool m_WantsPrompt = false;
    const char* m_File = nullptr;     // "-" is standard input
    std::vector<std::string> m_Args;  // the script, then its arguments
};

// What is left to do, or the status to leave with.
struct Start {
    bool m_Leaves = false;
    int m_Status = 0;
};

Start ReadOptions(int argc, char** argv, Options& options) {
    static const option kOptions[] = {
        {"help", no_argument, nullptr, 'h'},
        {"version", no_argument, nullptr, 'V'},
        {nullptr, 0, nullptr, 0},
    };
    // The '+' ends the options at the file: what follows belongs to the script.
    for (int found; (found = getopt_long(argc, argv, "+a:e:il:qhV", kOptions, nullptr)) != -1;) {
        switch (found) {
            case 'a':
                options.m_Port = optarg;
                break;
            case 'e':
                options.m_Texts.push_back(optarg);
                break;
            case 'i':
                options.m_WantsPrompt = true;
                break;
            case 'l':
                options.m_Language = optarg;
                break;
            case 'q':
                options.m_IsQuiet = true;
                break;
            case 'h':
                printf("%s\n%s", kUsage, kHelp);
                return {true, 0};
            case 'V':
                printf("oxscript %s (%s)\n", OXSCRIPT_VERSION, LUAJIT_VERSION);
                return {true, 0};
            default:
                fputs(kUsage, stderr);
                return {true, kUsageError};
        }
    }
    if (optind < argc) {
        options.m_File = argv[optind];
        options.m_Args.assign(argv + optind, argv + argc);
        return {};
    }
    options.m_Args = {argv[0]};
    if (options.m_Texts.empty() && !options.m_WantsPrompt) {
        options.m_WantsPrompt = isatty(STDIN_FILENO);
        if (!options.m_WantsPrompt) options.m_File = "-";
    }
    return {};
}

// A file without an extension, such as a program that begins with "#!", is Lua.
ScriptLanguage* FindLanguage(const Options& options) {
    ScriptLanguage* language = KorvelScript::g_LuaScriptLanguage;
    const char* told = options.m_Language;
    if (told) {
        language = KorvelScript::GetLanguageByName(told, true);
        if (!language) {
            fprintf(stderr, "%sthere is no language '%s', only lua, python, python2, python3\n",
                    kPrefix, told);
        }
    } else if (options.m_File) {
        const char* slash = strrchr(options.m_File, '/');
        const char* name = slash ? slash + 1 : options.m_File;
        told = strrchr(name, '.');
        if (told && told != name) language = KorvelScript::GetLanguageByExt(told, true);
        if (!language) {
            fprintf(stderr, "%sno language has files like %s; name one with -l\n", kPrefix, name);
        }
    }
    if (language && !language->IsAvailable()) {
        fprintf(stderr, "%sthe language %s is not available\n", kPrefix, language->GetName());
        return nullptr;
    }
    return language;
}

bool RunText(Runner& runner, const std::string& text, const char* name) {
    if (int line = FindBadLine(text)) {
        fprintf(stderr, "%s%s:%d: this is not UTF-8 text, and cannot be run\n", kPrefix, name,
                line);
        return false;
    }
    std::string chunkName = "=";  // shown as it is
    return runner.RunText(text, (chunkName += name).c_str());
}

// Runs a whole stream in the globals.
bool RunStream(Runner& runner, FILE* stream, const char* name) {
    std::string text;
    if (!stream || !ReadAll(stream, text)) {
        fprintf(stderr, "%scannot read %s: %s\n", kPrefix, name, strerror(errno));
        return false;
    }
    return RunText(runner, text, name);
}

bool RunFile(Runner& runner, const Options& options) {
    if (strcmp(options.m_File, "-") == 0) return RunStream(runner, stdin, "stdin");
    if (!options.m_WantsPrompt) return runner.RunFile(options.m_File);
    // As a file it would have an environment of its own, which the prompt does not see.
    FILE* file = Platform::fopen(options.m_File, "r");
    bool isGood = RunStream(runner, file, options.m_File);
    if (file) fclose(file);
    return isGood;
}

int RunAll(const Options& options) {
    ScriptLanguage* language = FindLanguage(options);
    if (!language) return kUsageError;
    ScriptVal app;
    std::string error;
    if (options.m_Port) {
        unsigned int port;
        if (!ReadPort(options.m_Port, port)) {
            fprintf(stderr, "%s'%s' is no port: that is a number from 1 to 65535\n", kPrefix,
                    options.m_Port);
            return kUsageError;
        }
        app = ConnectApplication(port, error);
    }
    if (!error.empty()) {
        fprintf(stderr, "%s%s\n", kPrefix, error.c_str());
        return kFailure;
    }
    Runner runner(language, options.m_Args, app,
                  options.m_WantsPrompt || options.m_IsQuiet ? "" : kPrefix, options.m_WantsPrompt);
    if (!runner.IsReady()) {
        fprintf(stderr, "%snot enough memory for a script\n", kPrefix);
        return kFailure;
    }
    if (options.m_WantsPrompt && !options.m_IsQuiet) {
        printf("oxscript %s (%s). Tab completes, Ctrl-C stops a script, Ctrl-D leaves.\n",
               OXSCRIPT_VERSION, LUAJIT_VERSION);
        if (RemoteApp* host = app.GetApp()) {
            printf("The application is %s, under the name app.\n",
                   static_cast<const char*>(host->GetName()));
        }
    }
    bool isGood = true;
    for (const std::string& text : options.m_Texts) {
        isGood = isGood && RunText(runner, text, "(command line)");
    }
    if (isGood && options.m_File) isGood = RunFile(runner, options);
    if (options.m_WantsPrompt && !runner.HasExited()) return RunPrompt(runner);
    // A text that can't be run has not given the runner a status.
    return isGood || runner.HasExited() ? runner.GetStatus() : kFailure;
}

}  // namespace
}  // namespace Korvel::Oxscript

int main(int argc, char** argv) {
    using namespace Korvel;
    Oxscript::Options options;
    Oxscript::Start start = Oxscript::ReadOptions(argc, argv, options);
    if (start.m_Leaves) return start.m_Status;
    KorvelScript::InitLanguages(TagList());
    int status = Oxscript::RunAll(options);
    CleanupScripting();
    KorvelScript::CleanupLanguages();
    return status;
}
