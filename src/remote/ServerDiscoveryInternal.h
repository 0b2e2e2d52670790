#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>
#include <unordered_map>

#include "remote/DiscoveryInternal.h"
#include "remote/HostRegistryInternal.h"

namespace Korvel {

// The script server's side of the discovery datagrams.

// What every answer tells of this machine: "Version", "HostName", "UserName" and "Platform".
ScriptVal DescribeMachine();

// The answer to a datagram, at most kMaxDatagram with its NUL; empty where there is none.
// `machine` is a table of DescribeMachine. What does not fit is left out entry by entry.
std::string AnswerDatagram(const HostRegistry& registry, std::string_view datagram,
                           const ScriptVal& machine);

// Lets nobody beyond this machine have more than a few answers a second, since a datagram may have
// a false sender whom the answers would flood. For one thread.
class AnswerLimiter {
public:
    static constexpr int kMostAnswers = 10;
    static constexpr int64_t kWindowMs = 1000;
    static constexpr size_t kMostAddresses = 4096;  // while so many are known, others get none

    // Whether an address, in network order, may have an answer now, which is then counted.
    bool Allow(unsigned int ip, int64_t nowMs);

private:
    struct Answers {
        std::array<int64_t, kMostAnswers> m_TimesMs;  // a ring
        int m_Count = 0;                              // of those that are filled in
        int m_Next = 0;
        int64_t m_LastMs = 0;
    };

    std::unordered_map<unsigned int, Answers> m_Answers;
};

}  // namespace Korvel
