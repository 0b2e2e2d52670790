#pragma once

#include "core/Export.h"

namespace Korvel {

class ScriptVal;
class TagList;
struct ScriptConfig;

// Installs the host's configuration, which must outlive scripting, and makes the calling thread the
// UI thread. Does nothing where one is installed. The list is not used.
KORVEL_EXPORT void InitScripting(ScriptConfig& config, TagList* tags = nullptr);

// The same, leaving the UI thread as it is.
KORVEL_EXPORT void _InitScripting(ScriptConfig& config, TagList* tags = nullptr);

// The UUID of this process, a text. It is made at first need and stays.
KORVEL_EXPORT const ScriptVal& GetAppUUID();

}  // namespace Korvel
