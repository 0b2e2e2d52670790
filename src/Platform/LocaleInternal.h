#pragma once

#include <locale.h>

namespace Korvel::Platform {

// The C locale, for texts that machines read. It lives as long as the process.
locale_t CLocale();

}  // namespace Korvel::Platform
