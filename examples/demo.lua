-- A first script: ./run examples/demo.lua
print("Hello from korvelscript " .. orv._VERSION .. ", process " .. orv.getpid())

-- LPeg is there without a require: read "width=1920, height=1080" into a table.
local space = lpeg.S " \t" ^ 0
local name = lpeg.C(lpeg.R "az" ^ 1)
local number = lpeg.R "09" ^ 1 / tonumber
local pair = lpeg.Cg(name * space * "=" * space * number)
local settings = lpeg.Cf(lpeg.Ct "" * pair * (space * "," * space * pair) ^ 0, rawset)
local frame = settings:match "width=1920, height=1080"
print("Parsed a frame of " .. frame.width .. " by " .. frame.height)

-- Compiled code: the luminance of every pixel of a frame.
local start = orv.gettime()
local sum = 0
for i = 1, frame.width * frame.height do
    sum = sum + 0.2126 * (i % 256) + 0.7152 * (i % 128) + 0.0722 * (i % 64)
end
local ms = (orv.gettime() - start) * 1000
print(string.format("Mean luminance %.3f, %d pixels in %.1f ms", sum / (frame.width * frame.height),
    frame.width * frame.height, ms))

print(#arg > 0 and "Arguments: " .. table.concat(arg, ", ") or "Give me arguments: ./run FILE ARGS")
return 0
