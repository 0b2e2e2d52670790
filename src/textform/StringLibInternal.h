#pragma once

#include "textform/State.h"

namespace Korvel::TextForm {

// A position that counts from the end when it is below 0.
inline int64_t GetPosition(int64_t position, size_t length) {
    if (position < 0) position += static_cast<int64_t>(length) + 1;
    return position >= 0 ? position : 0;
}

int StringFind(State& L);
int StringMatch(State& L);
int StringGmatch(State& L);
int StringGsub(State& L);
int StringFormat(State& L);

}  // namespace Korvel::TextForm
