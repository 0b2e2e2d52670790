#pragma once

#include <nlohmann/json.hpp>

#include "core/ScriptVal.h"

namespace Korvel::Bench {

// A table of settings, texts, numbers, booleans and tables by turns, in both forms.
ScriptVal OwnSettings(int count);
nlohmann::json JsonSettings(int count);

// Registers the rows of reading.
void AddReading();

}  // namespace Korvel::Bench
