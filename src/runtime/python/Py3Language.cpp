#include "runtime/python/Py3Language.h"

namespace Korvel::KorvelScript {

ScriptState* Py3ScriptLanguage::_NewState(ScriptObject*, unsigned int) {
    return nullptr;
}

}  // namespace Korvel::KorvelScript
