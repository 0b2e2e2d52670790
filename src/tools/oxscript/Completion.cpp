#include "tools/oxscript/Completion.h"

#include <algorithm>
#include <cctype>

#include "tools/oxscript/Runner.h"

namespace Korvel::Oxscript {
namespace {

constexpr std::string_view kKeywords[] = {
    "and",      "break",  "do",   "else", "elseif", "end",   "false", "for",
    "function", "goto",   "if",   "in",   "local",  "nil",   "not",   "or",
    "repeat",   "return", "then", "true", "until",  "while",
};

// Prints the names of the fields of a table that begin with a prefix, a line each. Its arguments
// are the prefix, what stands in front of it, and the names that lead from the globals to the
// table. The members of an object are taken from its help, whose lines are "  Class:Name() - what
// it does".
constexpr char kListFields[] = R"lua((function(prefix, mark, ...)
    local function show(name)
        if type(name) == "string" and name:find "^[%a_][%w_]*$" and
            name:sub(1, #prefix) == prefix then
            print(name)
        end
    end
    local objects = debug.getregistry()._ScriptObject
    local function is_object(value)
        return objects and type(value) == "userdata" and debug.getmetatable(value) == objects
    end
    local function show_members(object)
        local is_shown = {}
        for line in object:GetHelp(object.ClassName):gmatch "[^\n]+" do
            local kind, name = line:match "^  [%w_]*([:.])([%a_][%w_]*)"
            if kind == ":" or kind == mark then show(name) end
            if name then is_shown[name] = true end
        end
        -- Classes whose objects can be made.
        for _, name in pairs(object:GetHelpRaw()) do
            if name:sub(1, #prefix) == prefix and not is_shown[name] and
                type(object[name]) == "function" then
                show(name)
            end
        end
        if not pcall(function() object:IsAppConnected() end) then return end
        for name in ("SetTimeout GetTimeout IsAppConnected GetAppData " ..
            "SetAppFlags ClearAppFlags GetAppFlags"):gmatch "%a+" do
            show(name)
        end
        if mark == "." then show "LastError" end
    end
    local function parent(value)
        local meta = debug.getmetatable(value)
        local index = type(meta) == "table" and rawget(meta, "__index")
        return type(index) == "table" and index or nil
    end
    -- Chains of tables may be rings.
    local function chain(value)
        local tables = {}
        if type(value) ~= "table" then value = parent(value) end
        while value and #tables < 20 do
            tables[#tables + 1] = value
            value = parent(value)
        end
        return tables
    end
    local value = _G
    for _, name in ipairs { ... } do
        local found
        if is_object(value) then found = value[name] end
        for _, fields in ipairs(chain(value)) do
            if found ~= nil then break end
            found = rawget(fields, name)
        end
        value = found
    end
    if is_object(value) then return show_members(value) end
    for _, fields in ipairs(chain(value)) do
        for name in next, fields do show(name) end
    end
end))lua";

bool IsNameByte(char c) {
    return isalnum(static_cast<unsigned char>(c)) || c == '_';
}

// The names and separators at the end of a text, behind the last "..".
std::string_view LastPath(std::string_view text) {
    size_t start = text.size();
    while (start > 0 &&
           (IsNameByte(text[start - 1]) || text[start - 1] == '.' || text[start - 1] == ':')) {
        start--;
    }
    text.remove_prefix(start);
    size_t join = text.rfind("..");
    return join == text.npos ? text : text.substr(join + 2);
}

bool IsName(std::string_view name) {
    return !name.empty() && !isdigit(static_cast<unsigned char>(name[0]));
}

}  // namespace

Completions Complete(Runner& runner, std::string_view text) {
    std::string_view path = LastPath(text);
    std::string arguments;
    char mark = ' ';
    size_t end;
    // A separator in front belongs to a call or an index: nobody knows what that will give.
    while ((end = path.find_first_of(".:")) != path.npos) {
        if (!IsName(path.substr(0, end))) return {};
        mark = path[end];
        arguments += ", '" + std::string(path.substr(0, end)) + "'";
        path.remove_prefix(end + 1);
    }
    if (!path.empty() && !IsName(path)) return {};

    Completions found{path.size(), {}};
    std::string names = runner.Ask(
        kListFields + ("('" + std::string(path) + "', '" + mark + "'" + arguments + ")"));
    for (size_t start = 0; (end = names.find('\n', start)) != names.npos; start = end + 1) {
        found.m_Names.push_back(names.substr(start, end - start));
    }
    if (arguments.empty()) {
        for (std::string_view word : kKeywords) {
            if (word.starts_with(path)) found.m_Names.emplace_back(word);
        }
    }
    std::sort(found.m_Names.begin(), found.m_Names.end());
    auto last = std::unique(found.m_Names.begin(), found.m_Names.end());
    found.m_Names.erase(last, found.m_Names.end());
    return found;
}

}  // namespace Korvel::Oxscript
