#pragma once

#include <optional>
#include <string>
#include <vector>

namespace Korvel::Oxscript {

// A host, as the script server of its machine tells of it. Texts are what others claim.
struct Host {
    std::string m_Name;
    std::string m_UUID;
    double m_ProcessID;
    double m_Port;
};

// The address at which hosts and the script server of this machine are found: the loopback one,
// unless KORVEL_ListenAddress has them listen elsewhere.
std::string GetThisMachine();

// The hosts that are registered with the script server at an address; nothing where none answers.
std::optional<std::vector<Host>> AskServer(const char* address);

// A text of others, fit for a terminal.
std::string Clean(const std::string& text);

// Lists all hosts that can be found, on standard output: `oxscript --hosts`. Returns the tool's
// exit status.
int ListHosts(bool asJSON);

}  // namespace Korvel::Oxscript
