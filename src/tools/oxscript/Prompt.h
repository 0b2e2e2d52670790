#pragma once

namespace Korvel::Oxscript {

class Runner;

// Reads what somebody types, runs it and shows its values, until he leaves. Returns the tool's exit
// status.
int RunPrompt(Runner& runner);

}  // namespace Korvel::Oxscript
