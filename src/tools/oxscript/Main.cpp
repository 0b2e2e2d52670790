// oxscript: runs scripts on a state of korvelscript, or what somebody types at its prompt.
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <lua.hpp>

#include "Platform/Files.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptPort.h"
#include "remote/ScriptServer.h"
#include "tools/oxscript/Application.h"
#include "tools/oxscript/Hosts.h"
#include "tools/oxscript/Options.h"
#include "tools/oxscript/Prompt.h"
#include "tools/oxscript/Runner.h"
#include "tools/oxscript/Source.h"

namespace Korvel::Oxscript {
namespace {

using KorvelScript::ScriptLanguage;

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
    Application app;
    if (options.m_Port) {
        unsigned int port;
        if (!ReadPort(options.m_Port, port)) {
            fprintf(stderr, "%s'%s' is no port: that is a number from 1 to 65535\n", kPrefix,
                    options.m_Port);
            return kUsageError;
        }
        app = ConnectPort(port);
    } else if (options.m_Host) {
        app = ConnectHost(options.m_Host);
    }
    if (!app.m_Error.empty()) {
        fprintf(stderr, "%s%s\n", kPrefix, app.m_Error.c_str());
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
        if (RemoteApp* host = app.m_Object.GetApp()) {
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
    if (options.m_IsServer) {
        ScriptServerMain();
        return 0;
    }
    Oxscript::StartClient();
    KorvelScript::InitLanguages(TagList());
    int status =
        options.m_ListsHosts ? Oxscript::ListHosts(options.m_WantsJSON) : Oxscript::RunAll(options);
    CleanupScripting();
    KorvelScript::CleanupLanguages();
    return status;
}
