#pragma once

#include "core/Export.h"

// What the processor can do. The answers are found once and do not change. A processor of an
// unknown maker is credited with the basics alone.
namespace Korvel::Platform {

KORVEL_EXPORT bool Ox_IsPProProcessor();
KORVEL_EXPORT bool Ox_IsMMXProcessor();
KORVEL_EXPORT bool Ox_IsSSEProcessor();
KORVEL_EXPORT bool Ox_IsSSE2Processor();
KORVEL_EXPORT bool Ox_IsFTZProcessor();  // can flush denormal results to zero

// True when all of `bits` are set in the ECX word of CPUID leaf 1.
KORVEL_EXPORT bool Ox_IsECX(unsigned int bits);

KORVEL_EXPORT bool Ox_IsSSE3Processor();
KORVEL_EXPORT bool Ox_IsSSSE3Processor();
KORVEL_EXPORT bool Ox_IsSSE41Processor();
KORVEL_EXPORT bool Ox_IsSSE42Processor();
KORVEL_EXPORT bool Ox_IsSSE4aProcessor();  // always false

// These ask for the system's support, too.
KORVEL_EXPORT bool Ox_IsAVXProcessor();
KORVEL_EXPORT bool Ox_IsAVXIProcessor();  // with half precision conversions
KORVEL_EXPORT bool Ox_IsAVX2Processor();

KORVEL_EXPORT bool Ox_IsDAZProcessor();  // can take denormal inputs as zero

}  // namespace Korvel::Platform
