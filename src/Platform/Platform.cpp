#include "Platform/Platform.h"

#if defined(__x86_64__) || defined(__i386__)
#include <cpuid.h>

#include <cstring>
#include <initializer_list>
#endif

namespace Korvel::Platform {

#if defined(__x86_64__) || defined(__i386__)

namespace {

constexpr unsigned int Bit(unsigned int n) {
    return 1u << n;
}

constexpr unsigned int kEcxSSE3 = Bit(0);
constexpr unsigned int kEcxSSSE3 = Bit(9);
constexpr unsigned int kEcxSSE41 = Bit(19);
constexpr unsigned int kEcxSSE42 = Bit(20);
constexpr unsigned int kEcxOSXSave = Bit(27);
constexpr unsigned int kEcxAVX = Bit(28);
constexpr unsigned int kEcxF16C = Bit(29);
constexpr unsigned int kEdxFXSR = Bit(24);
constexpr unsigned int kEdxSSE = Bit(25);
constexpr unsigned int kLeaf7EbxAVX2 = Bit(5);
constexpr unsigned int kXcr0SSE = Bit(1);
constexpr unsigned int kXcr0AVX = Bit(2);

bool Has(unsigned int word, unsigned int bits) {
    return (word & bits) == bits;
}

bool IsKnownVendor() {
    unsigned int highest, text[3];
    if (!__get_cpuid(0, &highest, &text[0], &text[2], &text[1])) return false;
    for (const char* vendor : {"GenuineIntel", "AuthenticAMD", "VirtualApple"}) {
        if (memcmp(text, vendor, sizeof text) == 0) return true;
    }
    return false;
}

unsigned int ReadXcr0() {
    unsigned int low, high;
    __asm__("xgetbv" : "=a"(low), "=d"(high) : "c"(0));
    return low;
}

// All zero for an unknown vendor.
struct ProcessorWords {
    unsigned int m_Ecx = 0;  // of leaf 1
    unsigned int m_Edx = 0;  // of leaf 1
    unsigned int m_Leaf7Ebx = 0;
    bool m_HasAVX = false;

    ProcessorWords() {
        unsigned int eax, ebx, ecx, edx;
        if (!IsKnownVendor() || !__get_cpuid(1, &eax, &ebx, &m_Ecx, &m_Edx)) return;
        if (__get_cpuid_count(7, 0, &eax, &ebx, &ecx, &edx)) m_Leaf7Ebx = ebx;
        // Without OSXSAVE the instruction that reads XCR0 is not there.
        m_HasAVX = Has(m_Ecx, kEcxOSXSave | kEcxAVX) && Has(ReadXcr0(), kXcr0SSE | kXcr0AVX);
    }
};

const ProcessorWords& Words() {
    static const ProcessorWords s_Words;
    return s_Words;
}

}  // namespace

bool Ox_IsECX(unsigned int bits) {
    return Words().m_Ecx && Has(Words().m_Ecx, bits);
}
bool Ox_IsSSE3Processor() {
    return Ox_IsECX(kEcxSSE3);
}
bool Ox_IsSSSE3Processor() {
    return Ox_IsECX(kEcxSSSE3);
}
bool Ox_IsSSE41Processor() {
    return Ox_IsECX(kEcxSSE41);
}
bool Ox_IsSSE42Processor() {
    return Ox_IsECX(kEcxSSE42);
}
bool Ox_IsAVXProcessor() {
    return Words().m_HasAVX;
}
bool Ox_IsAVXIProcessor() {
    return Words().m_HasAVX && Ox_IsECX(kEcxF16C);
}
bool Ox_IsAVX2Processor() {
    return Words().m_HasAVX && Has(Words().m_Leaf7Ebx, kLeaf7EbxAVX2);
}
bool Ox_IsDAZProcessor() {
    return Has(Words().m_Edx, kEdxFXSR | kEdxSSE) && Ox_IsSSE3Processor();
}

#else

// What the other processors have in place of these, they always have.
bool Ox_IsECX(unsigned int bits) {
    return bits != 0x100000;
}
bool Ox_IsSSE3Processor() {
    return true;
}
bool Ox_IsSSSE3Processor() {
    return true;
}
bool Ox_IsSSE41Processor() {
    return true;
}
bool Ox_IsSSE42Processor() {
    return false;
}
bool Ox_IsAVXProcessor() {
    return true;
}
bool Ox_IsAVXIProcessor() {
    return true;
}
bool Ox_IsAVX2Processor() {
    return true;
}
bool Ox_IsDAZProcessor() {
    return false;
}

#endif

bool Ox_IsPProProcessor() {
    return true;
}
bool Ox_IsMMXProcessor() {
    return true;
}
bool Ox_IsSSEProcessor() {
    return true;
}
bool Ox_IsSSE2Processor() {
    return true;
}
bool Ox_IsFTZProcessor() {
    return true;
}
bool Ox_IsSSE4aProcessor() {
    return false;
}

}  // namespace Korvel::Platform
