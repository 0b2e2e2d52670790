#pragma once

#include "runtime/ScriptLanguage.h"

namespace Korvel::KorvelScript {

// Whether a Python 2 has been found on this machine. So far none is looked for.
constexpr bool g_HavePython2 = false;

// Python 2. It has a name and extensions, and makes no states where it is not available.
class KORVEL_EXPORT Py2ScriptLanguage : public ScriptLanguage {
public:
    unsigned int SizeOf() override { return sizeof(Py2ScriptLanguage); }
    ScriptState* _NewState(ScriptObject* object, unsigned int flags) override;
    bool IsAvailable() override { return g_HavePython2; }
    const char* GetName() override { return "Python2"; }
    const char* GetShortName() override { return "Py2"; }
    const char* GetMemberCallToken() override { return "."; }
};

}  // namespace Korvel::KorvelScript
