#pragma once

#include <string>
#include <vector>

namespace Korvel::Oxscript {

enum : int { kFailure = 255, kUsageError = 2 };  // exit statuses

constexpr char kPrefix[] = "oxscript: ";  // of what the tool itself has to say

// What the command line asks for.
struct Options {
    bool m_IsServer = false;  // be the script server, and nothing else
    bool m_ListsHosts = false;
    bool m_WantsJSON = false;
    const char* m_Port = nullptr;  // of the application
    const char* m_Host = nullptr;  // its name
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

// Reads the command line, and prints what that alone asks for.
Start ReadOptions(int argc, char** argv, Options& options);

}  // namespace Korvel::Oxscript
