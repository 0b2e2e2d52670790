#pragma once

#include <cstddef>

namespace Korvel {

// Who is there: a question and its answers, each a datagram, between Ping and the UDP port of
// script servers. docs/protocol.md tells the bytes.

constexpr size_t kMaxDatagram = 1024;  // of either kind
constexpr size_t kMagicSize = 4;
inline constexpr char kQuestionMagic[] = "SPP:";  // before a host's name, or nothing
inline constexpr char kAnswerMagic[] = "RSP:";    // before the text of a table, and a NUL

static_assert(sizeof kQuestionMagic == kMagicSize + 1 && sizeof kAnswerMagic == kMagicSize + 1);

}  // namespace Korvel
