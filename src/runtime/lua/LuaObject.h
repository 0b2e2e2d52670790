#pragma once

#include "core/Export.h"

struct lua_State;

namespace Korvel {

class LuaType;
class RemoteObject;

// The Lua face of objects: a userdata of the type "_ScriptObject". Each index, assignment, call and
// operator on it becomes one command to the object, which is sent and waited for; the results of
// the command are those of the expression. A command that fails has no results, and its error is
// left with the connection: scripts find it in the application object's LastError.
//
// An object of another process is a proxy, a RemoteObject that the userdata holds by IncRef. One of
// this process, which has come back over a connection, has a record of its own in its place, marked
// as local; there commands are calls within the process. Each connection through which it has come
// back has a userdata of its own for it, as commands leave their errors there.
//
// The application object, number 1 of a connection on either side, has functions of its own for
// that connection: SetTimeout, GetTimeout, IsAppConnected, GetAppData, SetAppFlags, ClearAppFlags
// and GetAppFlags. `class._ScriptObject(app, low, high, refLow, refHigh)` asks an application for
// its object at an address with a reference number, each in two halves.
KORVEL_EXPORT extern LuaType& s_LuaType_RemoteObject;

// Pushes the userdata of a proxy, or of a connection's record of a local object; nil for null.
// Without `keep` it takes over a reference of the caller's, even where it raises an error.
// Such a record goes with the connection's last reference or its run, and its userdata has a record
// of its own instead: it is pushed by this alone and never by lua_pushLuaObject.
KORVEL_EXPORT void _PushScriptObject(lua_State* L, RemoteObject* object, bool keep);

// The body of function values in Lua: calls the function on the object that is argument 1, with the
// arguments behind it. Without an object there is no call and no result.
extern "C" KORVEL_EXPORT int lua_function_call(lua_State* L);

}  // namespace Korvel
