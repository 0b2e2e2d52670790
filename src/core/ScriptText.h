#pragma once

#include "core/Export.h"
#include "core/ScriptVal.h"

struct cJSON;

namespace Korvel {

class TagList;

// The text and JSON forms of values, behind the members of ScriptVal, which tell the rest.

// What FromText and Load put in front of a text: a program that makes unknown names into
// constructors, and ends in "return ". `tags` is not used.
KORVEL_EXPORT const char* GetSerializePrologue(TagList* tags = nullptr);

// FromText and FromTextByName, into `out`. `options` is not used.
KORVEL_EXPORT bool _ScriptVal_FromText(ScriptVal& out, const char* text, const char* prefix,
                                       char* err, int errlen, bool freeText, unsigned int options);
KORVEL_EXPORT bool _ScriptVal_FromTextByName(ScriptVal& out, const char* text, const char* name,
                                             char* err, int errlen, bool freeText,
                                             unsigned int options);

// The tree of a value, which the caller gives to cJSON_Delete. Null where ToJSON would be false.
KORVEL_EXPORT cJSON* TocJSON(const ScriptVal& value);
// Reads a tree, which stays the caller's. False, with `out` unchanged, where FromJSON would be, for
// null, and for an item of no kind that a value has.
KORVEL_EXPORT bool FromcJSON(cJSON* item, ScriptVal& out);

}  // namespace Korvel
