#include "tools/oxscript/Options.h"

#include <getopt.h>
#include <unistd.h>

#include <cstdio>
#include <lua.hpp>

namespace Korvel::Oxscript {
namespace {

constexpr char kUsage[] =
    "Usage: oxscript [OPTIONS] FILE [ARGS...]\n"
    "       oxscript --hosts [--json]\n"
    "       oxscript -s\n";
constexpr char kHelp[] =
    "Runs a script with the libraries of korvelscript. FILE may be - for standard input. With no\n"
    "FILE it opens a prompt on a terminal, and runs what other standard input holds.\n"
    "\n"
    "The script finds its arguments in the table 'arg': 'name=value' as arg.name, all others as\n"
    "arg[1] to arg[arg.n]. The libraries 'orv' and 'lpeg' are there without a require.\n"
    "\n"
    "  --host NAME    work on the host of that name, on this machine or else in the network: it "
    "is\n"
    "                 the global 'app'\n"
    "  -a PORT        work on the host that listens at a port of this machine\n"
    "  -e TEXT        run a text, before FILE if there is one\n"
    "  -i             open the prompt afterwards; it sees the globals of FILE\n"
    "  -l LANGUAGE    lua, python, python2 or python3, where the name of FILE does not tell\n"
    "  -q             no banner at the prompt, and no 'oxscript:' in front of errors\n"
    "  --hosts        list the hosts on this machine and in the network, and leave\n"
    "  --json         list them as JSON\n"
    "  -s             be the script server, with which hosts register; it ends by itself when\n"
    "                 nobody needs it any more\n"
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
    "for a number outside 0 to 255, for a script that fails and for a host that is not found, 2\n"
    "for a wrong command line.\n";

Start RefuseUsage() {
    fputs(kUsage, stderr);
    return {true, kUsageError};
}

// Whether the options may stand together.
bool FitTogether(const Options& options, bool hasFile) {
    bool runs = hasFile || !options.m_Texts.empty() || options.m_WantsPrompt || options.m_Port ||
                options.m_Host || options.m_Language;
    if (options.m_Port && options.m_Host) return false;
    if (options.m_WantsJSON && !options.m_ListsHosts) return false;
    return options.m_ListsHosts + options.m_IsServer + runs <= 1;
}

}  // namespace

Start ReadOptions(int argc, char** argv, Options& options) {
    enum : int { kHost = 256, kHosts, kJSON };
    static const option kOptions[] = {
        {"help", no_argument, nullptr, 'h'},     {"host", required_argument, nullptr, kHost},
        {"hosts", no_argument, nullptr, kHosts}, {"json", no_argument, nullptr, kJSON},
        {"version", no_argument, nullptr, 'V'},  {nullptr, 0, nullptr, 0},
    };
    // The '+' ends the options at the file: what follows belongs to the script.
    for (int found; (found = getopt_long(argc, argv, "+a:e:il:qshV", kOptions, nullptr)) != -1;) {
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
            case 's':
                options.m_IsServer = true;
                break;
            case kHost:
                options.m_Host = optarg;
                break;
            case kHosts:
                options.m_ListsHosts = true;
                break;
            case kJSON:
                options.m_WantsJSON = true;
                break;
            case 'h':
                printf("%s\n%s", kUsage, kHelp);
                return {true, 0};
            case 'V':
                printf("oxscript %s (%s)\n", OXSCRIPT_VERSION, LUAJIT_VERSION);
                return {true, 0};
            default:
                return RefuseUsage();
        }
    }
    if (!FitTogether(options, optind < argc)) return RefuseUsage();
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

}  // namespace Korvel::Oxscript
