#pragma once

#include "textform/State.h"

namespace Korvel::TextForm {

void RegisterLoading(State& L);  // load, loadstring, loadfile, dofile

}  // namespace Korvel::TextForm
