-- Older global names of library functions, and helpers that scripts have always had.
local orv, globals = orv, getfenv()
local error, getfenv, loadfile, loadstring, pairs, pcall, rawequal, rawget, select, setfenv,
    setmetatable, tostring, type = error, getfenv, loadfile, loadstring, pairs, pcall, rawequal,
    rawget, select, setfenv, setmetatable, tostring, type
local strmatch, rep, concat = string.match, string.rep, table.concat

getpid, wait, exit, pinghosts = orv.getpid, orv.wait, orv.exit, orv.pinghosts
StartServer, GetAppName, GetAppUUID = orv.startserver, orv.getappname, orv.getappuuid
CreateUUID, SendNotify = orv.createuuid, orv.sendnotify
ScriptApp, AsyncScriptApp = orv.scriptapp, orv.asyncscriptapp
Using, SetActiveComp = orv.using, orv.using
GetUsing, GetActiveComp = orv.getusing, orv.getusing

-- The applications of the house, by name.
for _, name in ipairs { "Korvel", "KorvelServer", "Torvane", "Harwick", "Tessmere" } do
    globals[name] = function(ip, timeout, uuid, subtype)
        return orv.scriptapp(name, ip, timeout, uuid, subtype)
    end
end

-- The application that this process is; nil where it has no name.
function ThisApp(timeout)
    local name = orv.getappname()
    return name and orv.scriptapp(name, "127.0.0.1", timeout, orv.getappuuid())
end

-- Raises the error of a helper's first argument where the helper has been called.
local function check(value, expected, name)
    if type(value) ~= expected then
        error("bad argument #1 to '" .. name .. "' (" .. expected .. " expected, got " ..
            type(value) .. ")", 3)
    end
end

function iif(cond, a, b)
    if cond then return a else return b end
end

-- Calls f and returns its result, or true when it has none. An error is printed, and so is `err`
-- in place of a call when there is no f: what loadstring returns can be passed on as it is.
function do_(f, err)
    local ok, result = false, err
    if f or err == nil then ok, result = pcall(f) end
    if not ok then
        print(result)
        return nil
    end
    if result == nil then return true end
    return result
end

function dostring(s)
    check(s, "string", "dostring")
    return do_(loadstring(s))
end

-- Gives `emit` a line for a value and, one tab deeper, a line for each field of a table. A table
-- that is not walked gets a mark, behind its own line or, with `brief`, in place of it.
local function walk(value, label, level, seen, emit, brief)
    local mark
    if type(value) == "table" then
        if level > 0 and rawequal(value, globals) then
            mark = "<<global table>>"
        elseif seen[value] then
            mark = "<<recursive reference>>"
        end
    end
    local indent = rep("\t", level)
    if not (mark and brief) then emit(indent .. label .. tostring(value)) end
    if mark then
        emit(indent .. mark)
    elseif type(value) == "table" then
        seen[value] = true
        for key, field in pairs(value) do
            walk(field, tostring(key) .. " = ", level + 1, seen, emit, brief)
        end
    end
end

function dump(...)
    for i = 1, select("#", ...) do
        walk((select(i, ...)), "", 0, {}, function(line) print(line) end, false)
    end
end

function dumptostring(...)
    local lines = {}
    local function emit(line) lines[#lines + 1] = line .. "\n" end
    for i = 1, select("#", ...) do walk((select(i, ...)), "", 0, {}, emit, true) end
    return concat(lines)
end

-- The folder with its separator, the name and the extension without its dot; what is missing is
-- empty. A name such as ".profile" has no extension.
function splitpath(filename)
    check(filename, "string", "splitpath")
    local path = strmatch(filename, "^.*[/\\]") or ""
    local rest = filename:sub(#path + 1)
    local name, extension = strmatch(rest, "^(.+)%.([^.]*)$")
    return path, name or rest, extension or ""
end

match = strmatch

local function index(ns, name) return ns[name] end

function safegetsymbol(ns, name)
    local ok, value = pcall(index, ns, name)
    if ok then return value end
    return nil
end

function trace(...)
    print(...)
    return ...
end

-- The environment of whoever has called the helper that asks; the globals when it cannot be told,
-- such as behind a tail call. Counted from getfenv: pcall, this function, the helper, its caller.
local function callerenv()
    local ok, env = pcall(getfenv, 4)
    return ok and env or globals
end

-- Calls f in an environment of its own. Names that f sets stay there, or go through `globals`;
-- names that it does not find there are the caller's.
local function callprivate(env, f, ...)
    local private = { globals = rawget(globals, "globals") or globals }
    setfenv(f, setmetatable(private, { __index = env }))
    return f(...)
end

function callglob(f, ...)
    check(f, "function", "callglob")  -- a number would change the environment of a caller
    return callprivate(callerenv(), f, ...)
end

function ldofile(file, ...)
    check(file, "string", "ldofile")  -- nothing would mean standard input
    local env = callerenv()
    local f, err = loadfile(file)
    if not f then error(err, 2) end
    return callprivate(env, f, ...)
end

function printerr(err)
    local alert = rawget(globals, "_ALERT")
    if alert then
        alert(err)
    else
        io.stderr:write(tostring(err), "\n")
    end
end
