#pragma once

#include "core/OxID.h"
#include "core/ScriptVal.h"

// What scripts are told about classes and their members: as text, and as tables for those who set
// their own. The records are read without a lock. Without memory the answers are nil,
// or leave something out.
namespace Korvel {

class ScriptInfo;
class ScriptSymbol;
class TagList;

// A place in a list of help tags.
class HelpTags {
public:
    explicit HelpTags(const TagList& tags);

    explicit operator bool() const { return m_Item != nullptr; }
    bool Is(unsigned long long tag) const { return m_Item && *m_Item == tag; }
    const char* GetText() const;  // of the tag here; may be null
    void Step();

    // Read a tag that stands here and step behind it. False, with nothing done, for another one.
    bool Take(unsigned long long tag, const char*& text);
    bool Take(unsigned long long tag, bool& value);

private:
    const TagList& m_Tags;
    const unsigned long long* m_Item;
};

// Whether the help tells of a member: it has a name, is no constant, and neither hidden nor for
// debug mode, but that this shows them.
bool IsInHelp(const ScriptSymbol& symbol);

// The long help of a member, from its tags: each usage as a line with its description, then the
// paragraphs and samples.
OxID ComposeLongHelp(const ScriptSymbol& symbol);

// The help for a class name, alone or with a member's behind ".", ":" or "/"; the list of classes
// for no text. Nil when there is no such class or member.
ScriptVal GetHelpText(const char* topic);

// The names of the classes that have one, all or those with members of their own.
ScriptVal GetClassNames(bool all);
// The same as above as tables.
ScriptVal GetClassTable(const char* className);
ScriptVal GetMemberTable(const char* className, const char* member);

}  // namespace Korvel
