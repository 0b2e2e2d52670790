#pragma once

#include <string>

#include "core/ScriptVal.h"

namespace Korvel::Oxscript {

// The application that a script works on.
struct Application {
    ScriptVal m_Object;   // a proxy; nil when there is none
    ScriptVal m_Startup;  // a table of what it has kept for this process, which it has started; nil
                          // for nothing
    std::string m_Error;  // why there is none, when one has been asked for
};

// A port from a text; false when it is none.
bool ReadPort(const std::string& text, unsigned int& port);

// Makes this process a client, so that it and its scripts can connect.
void StartClient();

// Connect to the application that listens at a port of this machine, and to the host of a name: of
// this machine if there is one, else of another one that answers to a broadcast.
Application ConnectPort(unsigned int port);
Application ConnectHost(const std::string& name);

// The errors of calls that no script has asked for, a line each, and forgets them.
std::string TakePendingErrors();

}  // namespace Korvel::Oxscript
