#pragma once

#include <cstdint>

namespace Korvel::TextForm {

// The additive feedback generator of the C library's rand(), with a sequence for each machine.
class Random {
public:
    static constexpr double kMax = 2147483647;

    uint32_t Next() {  // 0 to kMax
        if (!m_IsSeeded) Seed(1);
        uint32_t value = m_Words[m_Place] += m_Words[(m_Place + 28) % 31];
        m_Place = (m_Place + 1) % 31;
        return value >> 1;
    }

    void Seed(uint32_t seed) {
        m_IsSeeded = true;
        int64_t word = static_cast<int32_t>(seed ? seed : 1);
        for (uint32_t& slot : m_Words) {
            slot = static_cast<uint32_t>(word);
            word = word * 16807 % 2147483647;
            if (word < 0) word += 2147483647;
        }
        m_Place = 3;
        for (int i = 0; i < 310; i++) Next();
    }

private:
    uint32_t m_Words[31];
    int m_Place = 0;
    bool m_IsSeeded = false;
};

}  // namespace Korvel::TextForm
