-- Tables that remember the order in which their keys came. A key that is set to nil keeps its place.
local rawget, rawset, setmetatable = rawget, rawset, setmetatable

_orderedtable_meta = {}
local meta = _orderedtable_meta

-- Lua asks this for absent keys alone, so that a key which is assigned again stays where it is.
function meta.__newindex(self, key, value)
    rawset(self, key, value)
    local positions = self.__keytoidx
    if positions[key] then return end
    local keys = self.__idxtokey
    local position = #keys + 1
    keys[position] = key
    positions[key] = position
end

-- for key, value in _orderedtable_next, t do ... end
function _orderedtable_next(self, key)
    local position = 0
    if key ~= nil then position = self.__keytoidx[key] end
    local following
    if position then following = self.__idxtokey[position + 1] end
    if following ~= nil then return following, rawget(self, following) end
    return nil
end

local step = _orderedtable_next

function meta.__pairs(self)
    return step, self, nil
end

function table.ordered()
    return setmetatable({ __idxtokey = {}, __keytoidx = {} }, meta)
end
