#pragma once

#include "core/Export.h"
#include "objects/ObjectReferences.h"

namespace Korvel {

// A connection to another process, or to this one. Here it only carries the process's object
// references.
class KORVEL_EXPORT RemoteApp : public ObjectReferences {
public:
    RemoteApp() = delete;
};

}  // namespace Korvel
