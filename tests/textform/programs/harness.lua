-- Runs pieces of program and prints all that they give, without what differs between runs.
local function plain(v)
    if type(v) == "number" and v ~= v then return "nan" end -- its sign is the processor's
    return (tostring(v):gsub("0x%x+", "ADDRESS"):gsub("%z", "<0>"))
end

function show(...)
    local n = select("#", ...)
    local texts = {}
    for i = 1, n do texts[i] = plain((select(i, ...))) end
    print(n, unpack(texts, 1, n))
end

function walk(t)
    local n = 0
    for k, v in pairs(t) do
        n = n + 1
        io.write(plain(k), "=", plain(v), " ")
    end
    print("", n)
end

function run(cases)
    for i, text in ipairs(cases) do
        io.write(i, " ")
        local f, message = loadstring(text, "=case")
        if f then show(pcall(f)) else show("no chunk", message) end
    end
end

-- The same numbers in every interpreter.
local state = 12345
function random(n)
    state = (state * 16807) % 2147483647
    return state % n + 1
end

function pick(list) return list[random(#list)] end
