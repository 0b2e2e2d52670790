#pragma once

#include "runtime/ScriptLanguage.h"

namespace Korvel::KorvelScript {

// Whether a Python 3 has been found on this machine. So far none is looked for.
constexpr bool g_HavePython3 = false;

// Python 3. It has a name and extensions, and makes no states where it is not available.
class KORVEL_EXPORT Py3ScriptLanguage : public ScriptLanguage {
public:
    unsigned int SizeOf() override { return sizeof(Py3ScriptLanguage); }
    ScriptState* _NewState(ScriptObject* object, unsigned int flags) override;
    bool IsAvailable() override { return g_HavePython3; }
    const char* GetName() override { return "Python3"; }
    const char* GetShortName() override { return "Py3"; }
    const char* GetMemberCallToken() override { return "."; }
};

}  // namespace Korvel::KorvelScript
