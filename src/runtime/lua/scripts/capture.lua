-- A function that collects all that its caller can see. Locals hide upvalues, and what is neither is
-- looked up in the caller's environment.
local getinfo, getupvalue, getlocal = debug.getinfo, debug.getupvalue, debug.getlocal
local getfenv, setmetatable, sub = getfenv, setmetatable, string.sub

return function()
    local vars = {}
    local caller = getinfo(2, "f").func
    local i = 1
    while true do
        local name, value = getupvalue(caller, i)
        if not name then break end
        vars[name] = value
        i = i + 1
    end
    i = 1
    while true do
        local name, value = getlocal(2, i)
        if not name then break end
        if sub(name, 1, 1) ~= "(" then vars[name] = value end
        i = i + 1
    end
    local env = getfenv(caller)
    return setmetatable(vars, { __index = env, __newindex = env })
end
