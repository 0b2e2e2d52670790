dofile "harness.lua"
-- Programs made up at random, the same in both interpreters.

-- Expressions over a few variables of all types: results and messages.
local atoms = {
    "1", "2.5", "-3", "0", "'a'", "'10'", "''", "nil", "true", "{}", "n", "s", "t", "u", "t.x", "t.y", "f", "f(1)",
    "t[1]", "#s", "#t", "t.t.x", "u.v", "s.x", "gn", "t:m(2)", "f()", "(f(1, 2))", "0x1F", "1e3", "tostring(n)", "[[l]]", "...",
}
local binary = {"+", "-", "*", "/", "%", "^", "..", "==", "~=", "<", "<=", ">", ">=", "and", "or"}
local unary = {"-", "not ", "#"}
local function expression(depth)
    local kind = random(10)
    if depth == 0 or kind <= 2 then return pick(atoms) end
    if kind <= 7 then return expression(depth - 1) .. " " .. pick(binary) .. " " .. expression(depth - 1) end
    if kind == 8 then return pick(unary) .. expression(depth - 1) end
    if kind == 9 then return "(" .. expression(depth - 1) .. ")" end
    return "({" .. expression(depth - 1) .. ", x = " .. expression(depth - 1) .. "})[" .. expression(depth - 1) .. "]"
end
local head = "local n, s, u, f = 7, 'str', nil, function(a) return a end gn = 5 "
    .. "local t = {1, 2, x = 3, t = {}, m = function(self, k) return k end} "
local cases = {}
for i = 1, 1500 do cases[i] = head .. "return " .. expression(3) end
run(cases)

-- Statements, whole and with a token lost, doubled or changed: what the parser says.
local statements = {
    "local a , b = 1 , f ( x ) if a < b then return a elseif a == b then a = b else b = a end",
    "for i = 1 , 10 , 2 do local x = { i , i * 2 , y = i ; [ i ] = 'z' } print ( x . y ) end",
    "while a do repeat local c = a . b : c ( d ) [ 1 ] until c break end",
    "function m . n : o ( p , ... ) local q = ... return p , q , ... end",
    "local function g ( ) return function ( ) g ( ) end end g { 1 } g 'x' g [[y]]",
    "for k , v in pairs ( t ) do t [ k ] , v = v , k end do local x = - 1 ^ 2 .. 'a' end",
    "a . b [ c ] . d = not # e and - f or ( g + h ) * 2 % 3 / 4 ; x = 1",
}
local tokens = {"end", "=", "(", ")", "{", "}", "local", "if", "then", "do", ",", ";", "'s'", "12", "name", "...", "..", "[", "]", "return", "function", "and", "==", "until", "\n", ":", "."}
cases = {}
for i = 1, 1500 do
    local words = {}
    for w in pick(statements):gmatch("%S+") do words[#words + 1] = w end
    for change = 1, random(2) do
        local kind, at = random(3), random(#words)
        if kind == 1 then table.remove(words, at)
        elseif kind == 2 then table.insert(words, at, pick(tokens))
        else words[at] = pick(tokens) end
    end
    local text = "do local pairs, print, f = next, type, type " .. table.concat(words, " ") .. " end"
    cases[i] = text
end
for i, text in ipairs(cases) do
    local f, message = loadstring(text, "=s")
    print(i, f and "ok" or message)
end

-- Tables that grow and shrink: the order of a walk, borders and next.
for round = 1, 150 do
    local t, names = {}, {}
    for i = 1, random(60) do
        local kind = random(12)
        if kind <= 5 then
            local name = pick {"k", "key_", "x.", "a long name for a key that is hashed in steps "} .. random(80)
            t[name] = i
            names[#names + 1] = name
        elseif kind <= 8 then t[random(24)] = i
        elseif kind == 9 then t[random(100) / 8] = i
        elseif kind == 10 then t[-random(50)] = i
        elseif kind == 11 and #names > 0 then t[pick(names)] = nil
        else t[#t + 1] = i end
    end
    walk(t)
    local keys = {}
    for k in next, t do keys[#keys + 1] = k end
    for _, k in ipairs(keys) do if random(3) == 1 then t[k] = nil end end
    print(#t, table.maxn(t))
    walk(t)
end
for round = 1, 60 do
    local fields = {}
    for i = 1, random(20) do
        fields[i] = pick {"1", "a" .. random(30) .. " = 2", "['b" .. random(30) .. "'] = 3", "[" .. random(9) .. "] = 4", "nil", "(f())", "f()"}
    end
    local t = loadstring("local function f() return 7, 8, 9 end return {" .. table.concat(fields, ", ") .. "}")()
    io.write(#t, " ")
    walk(t)
end

-- Patterns and formats.
local pieces = {"a", "b", ".", "%a", "%d", "%s", "%w", "[ab]", "[^b]", "[%d_]", "a*", "b-", "%w+", ".-", "a?", "(", ")", "()", "%1", "%b()", "%f[%w]", "^", "$", "%", "[", "]", "-", "%%", "%."}
local texts = {"abba", "a(b(c)d)e", "aab 12_3", "", "xyz", "a.b-c%d", "aaaaaaaa", "hello world from lua"}
for i = 1, 2500 do
    local p = {}
    for j = 1, random(5) do p[j] = pick(pieces) end
    p = table.concat(p)
    local text = pick(texts)
    io.write(p, "\t")
    show(pcall(string.find, text, p, random(4) - 2))
    show(pcall(string.gsub, text, p, pick {"<%0>", "%1", "x", "%%"}, random(3)))
end
for i = 1, 1500 do
    local f = "%" .. pick {"", "", "-", "+", " ", "#", "0", "-+", "00"} .. pick {"", "", "5", "12", "1", "100"}
        .. pick {"", "", ".0", ".3", ".", ".12", ".100"} .. pick {"d", "i", "u", "x", "X", "o", "c", "e", "E", "f", "g", "G", "s", "q", "z", ""}
    local v = pick {0, 1, -1, 42, 3.7, -2.5, 1e10, 1e100, 1/3, "text", "12", "a\0b", 255, 65, 1e15, 123456789}
    io.write(f, "\t")
    show(pcall(string.format, f, v))
end

-- Numbers as text.
for i = 1, 3000 do
    local m = (random(2147483646) * 4194304 + random(4194304)) * (random(2) == 1 and -1 or 1)
    local n = m * 2 ^ (random(300) - 200)
    local text = ("%.17g"):format(n)
    print(n, text, tonumber(text) == n, n % 7, math.floor(n / 3))
end

-- Sorts, with orders that contradict themselves now and then.
for i = 1, 300 do
    local t = {}
    for j = 1, random(40) do t[j] = random(20) end
    local kind = random(4)
    local calls = 0
    local compare = kind == 1 and function(a, b) calls = calls + 1 return a < b end
        or kind == 2 and function(a, b) calls = calls + 1 return a <= b end
        or kind == 3 and function(a, b) calls = calls + 1 return (a * 7 + b * 3) % 5 < 2 end
    io.write(calls, " ")
    show(pcall(table.sort, t, compare or nil), table.concat(t, ",", 1, #t))
end
