#include "runtime/python/Py2Language.h"

namespace Korvel::KorvelScript {

ScriptState* Py2ScriptLanguage::_NewState(ScriptObject*, unsigned int) {
    return nullptr;
}

}  // namespace Korvel::KorvelScript
