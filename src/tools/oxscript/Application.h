#pragma once

#include <string>

#include "core/ScriptVal.h"

namespace Korvel::Oxscript {

// A port from a text; false when it is none.
bool ReadPort(const std::string& text, unsigned int& port);

// Connects to the application that listens at a port of this machine. Gives its object, or nil with
// the reason in `error`.
ScriptVal ConnectApplication(unsigned int port, std::string& error);

// The errors of calls that no script has asked for, a line each, and forgets them.
std::string TakePendingErrors();

}  // namespace Korvel::Oxscript
