#include "runtime/RuntimeHooksInternal.h"

namespace Korvel {

constinit RuntimeHooks g_RuntimeHooks;

}  // namespace Korvel
