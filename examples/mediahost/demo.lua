-- What a script does with the application of mediahost, while that runs:
--   oxscript --host MediaHost demo.lua
local function heading(text)
    print("\n" .. text .. "\n" .. ("-"):rep(#text))
end

heading "An application in another process"
app:SetTimeout(10) -- seconds that a call may take
print("This is process " .. orv.getpid() .. ", and app is " .. tostring(app))
print("It is a " .. app.ClassName .. ", with " .. app.FramesPerSecond .. " pictures a second.")

heading "Objects, functions and variables"
app.Title = "A walk by the sea"
local timeline = app.Timeline
for name, length in ("Beach 4, Harbour 2.5, Sunset 6"):gmatch "(%a+) ([%d.]+)" do
    timeline:Add(app:Clip(name, tonumber(length))) -- the clip is made there, and handed back
end
print(app.Title .. " has " .. #timeline:GetClips() .. " clips and takes " .. timeline.Duration .. " s.")

heading "Lists of objects, and names that no member has"
for i, clip in ipairs(timeline:GetClips()) do
    print(i, clip.Name, ("from %4.1f s, %3.1f s long"):format(clip.Start, clip.Length))
end
print("timeline.Sunset begins at " .. timeline.Sunset.Start .. ", and timeline[4] is", timeline[4])

heading "Attributes"
timeline[1]:SetAttrs { name = "The " .. timeline[1].Name, length = 3 }
for name, value in pairs(timeline[1]:GetAttrs()) do
    print(name, value)
end

heading "Bytes"
local pixels = timeline[1]:GetFrame(1.5)
print(tostring(pixels) .. ", of which one line looks like this:")
local shades = " .:-=+*#%@"
local line = {}
for x = 1, 64 do
    local shade = math.floor(pixels[64 * 18 + x] / 256 * #shades) + 1
    line[x] = shades:sub(shade, shade)
end
print(table.concat(line))

heading "An answer that comes later"
local start = orv.gettime()
local frames, brightness = timeline:Render()
print(("%d pictures of brightness %.1f in %.0f ms"):format(frames, brightness,
    (orv.gettime() - start) * 1000))

heading "Progress, meanwhile"
timeline:Add(app:Clip("The long way home", 600))
app:SetTimeout(0.1) -- too short for this: the script goes on, and so does the render
print("In 0.1 s the render has given", (timeline:Render()))
app:SetTimeout(10)
start = orv.gettime()
repeat
    local progress = app.Progress -- an answer leaves at most every half second
    print(("%3.0f %% done after %.1f s"):format(progress * 100, orv.gettime() - start))
until progress == 1

heading "Errors"
print("A clip of no length:", (app:Clip("Nothing", 0)))
print("The reason:", app.LastError)
timeline[1].Length = -1
print("A length of -1:", timeline[1].Length, app.LastError)
timeline[1]:SetAttrs { length = -1 }
print("As an attribute it is left out:", timeline[1].Length, app.LastError)

heading "Help"
print(app:GetHelp "Timeline:Add")
print(app:GetHelp "MediaHost")
app:Reset() -- a new film, so that the next script finds the host as this one did
