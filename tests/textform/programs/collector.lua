dofile "harness.lua"
-- The collector under small steps, with everything that it owns in motion.
collectgarbage("setpause", 100)
collectgarbage("setstepmul", 150)
local finalized = 0
local function proxy(note)
    local p = newproxy(true)
    local m = getmetatable(p)
    m.__gc = function() finalized = finalized + 1 end
    m.__index = {note = note}
    return p
end
local weakKeys, weakValues = setmetatable({}, {__mode = "k"}), setmetatable({}, {__mode = "v"})
local kept = {}
for i = 1, 400 do
    local closures, shared = {}, i
    for j = 1, 5 do closures[j] = function() shared = shared + j return shared end end
    local co = coroutine.wrap(function(a)
        local t = {a}
        while true do
            t = {t[1] + 1, tostring(t[1]), function() return t end}
            a = coroutine.yield(t[1])
        end
    end)
    co(i)
    local key = {}
    weakKeys[key] = {i}
    weakKeys[i] = {}
    local value = {i}
    weakValues[i] = value
    weakValues[-i] = "text" .. i
    if i % 10 == 0 then kept[#kept + 1] = {key, closures, co, proxy(i), value} end
    proxy(i)
    if i % 3 == 0 then collectgarbage("step", i % 2) end
    if i % 100 == 0 then collectgarbage() end
    print(i, closures[1](), closures[5](), co())
end
collectgarbage()
collectgarbage()
local total, keys, values = 0, 0, 0
for _, k in ipairs(kept) do
    total = total + weakKeys[k[1]][1] + k[2][3]() + k[3]() + k[4].note + k[5][1]
end
for k in pairs(weakKeys) do keys = keys + 1 end
for k, v in pairs(weakValues) do values = values + 1 end
print(#kept, total, keys, values, finalized)
kept = nil
collectgarbage()
collectgarbage()
local left = 0
for k, v in pairs(weakValues) do if type(v) ~= "string" then left = left + 1 end end
print(next(weakKeys) ~= nil, left, finalized)

-- Strings that come and go; a table walked while its entries are cleared and it is collected.
local t = {}
for i = 1, 3000 do t["key" .. i] = ("v"):rep(i % 50) .. i end
local seen = 0
for k in pairs(t) do
    t[k] = nil
    seen = seen + 1
    if seen % 100 == 0 then collectgarbage() end
end
print(seen, next(t))
for round = 1, 20 do
    local list = {}
    for i = 1, 500 do list[i] = setmetatable({name = "n" .. i}, {__index = {round = round}}) end
    for i = 1, 500, 2 do list[i] = nil end
    collectgarbage("step", 2)
    print(round, list[2].name, list[500].round, list[1])
end
-- A finaliser that brings its object back, and one that makes garbage.
local back
do
    local p = newproxy(true)
    getmetatable(p).__gc = function(u) back = u for i = 1, 100 do local x = {i} end end
end
collectgarbage() collectgarbage()
print(type(back))
back = nil
collectgarbage() collectgarbage()
print(back)
-- Up-values of threads that nobody keeps.
local out = {}
for i = 1, 50 do
    coroutine.wrap(function()
        local v = {i}
        out[i] = function() return v[1] end
        coroutine.yield()
    end)()
    if i % 5 == 0 then collectgarbage("step", 0) end
end
collectgarbage()
local sum = 0
for i = 1, 50 do sum = sum + out[i]() end
print(sum)
