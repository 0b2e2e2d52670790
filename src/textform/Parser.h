#pragma once

#include "textform/State.h"

namespace Korvel::TextForm {

class Source;

// Compiles a chunk of source text to the function of its top level. Raises syntax errors.
Prototype* Parse(State& L, Source& source, const char* chunkName);

}  // namespace Korvel::TextForm
