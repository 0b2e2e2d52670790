#include "runtime/lua/LuaObject.h"

#include <atomic>
#include <bit>
#include <climits>
#include <cstring>
#include <lua.hpp>

#include "core/0ReusePool.h"
#include "core/NumbersInternal.h"
#include "core/OxString.h"
#include "core/ScriptValInternal.h"
#include "objects/LuaClass.h"
#include "objects/ScriptConfig.h"
#include "objects/ScriptSymbol.h"
#include "remote/RemoteApp.h"
#include "remote/RemoteObject.h"
#include "runtime/lua/KRScriptLibInternal.h"
#include "runtime/lua/LuaGuardInternal.h"
#include "runtime/lua/LuaObjectInternal.h"
#include "runtime/lua/LuaType.h"
#include "runtime/lua/LuaValues.h"

namespace Korvel {
namespace {

constexpr char kTypeName[] = "_ScriptObject";
constexpr uint32_t kRootID = 1;

// Stands in a userdata for an object of this process. A connection's own record of an export will
// not do: it goes when the peer lets go of the object. Number 0, which no connection gives, tells
// it from those.
struct LocalObject : RemoteObject, Reuser {
    LocalObject(RemoteApp* app, const ScriptVal& value, bool isRoot)
        : RemoteObject{0, 0, value.ToLocalObject(), app, nullptr, true},
          m_Value(value),
          m_IsRoot(isRoot) {
        app->Use();
    }
    LocalObject(const LocalObject&) = delete;
    LocalObject& operator=(const LocalObject&) = delete;
    ~LocalObject() { m_App->Recycle(); }

    void Use() { m_NumUses++; }
    void Recycle() {
        if (--m_NumUses == 0) delete this;
    }

    const ScriptVal m_Value;  // knows whether the object still lives
    const bool m_IsRoot;      // number 1 of its connection
    std::atomic<uint32_t> m_NumUses{1};
};

LocalObject* AsLocalObject(RemoteObject* object) {
    return object->IsLocal() && !object->m_ID ? static_cast<LocalObject*>(object) : nullptr;
}

// An object that must not go while scripts run, which may let go of its userdata. Holds nothing at
// first.
class Held {
public:
    Held() = default;
    Held(const Held&) = delete;
    Held& operator=(const Held&) = delete;
    ~Held() {
        if (m_Object) Recycle(m_Object);
    }

    void Hold(RemoteObject* object) {
        if (!m_Object) Use(object);
        m_Object = object;
    }

    static void Use(RemoteObject* object) {
        if (LocalObject* local = AsLocalObject(object)) return local->Use();
        object->IncRef();
    }
    static void Recycle(RemoteObject* object) {
        if (LocalObject* local = AsLocalObject(object)) return local->Recycle();
        object->DecRef();
    }

private:
    RemoteObject* m_Object = nullptr;
};

// A value on an object that is local; nil when it has died.
ScriptVal LocalValue(RemoteObject* object) {
    LocalObject* local = AsLocalObject(object);
    return local ? local->m_Value : ScriptVal();
}

// A value on the local object that has a number on a connection; nil when there is none.
ScriptVal ExportedValue(RemoteApp* app, uint32_t id) {
    RemoteObject* record = app ? app->FindLocalObject(id) : nullptr;
    if (!record || !record->m_Object) return {};
    ScriptVal value(record->m_Object);
    record->m_Object->DecRef();  // the look-up's count
    return value;
}

// Commands

// What stands at key 0 of a command.
struct Selector {
    enum { None, Key, Function } m_Kind = None;  // a key is the first of the values
    uint64_t m_Function = 0;
    uint32_t m_Flags = 0;  // of the function
};

void RaiseUnsupportedKey(lua_State* L) {
    luaL_error(L, "Unsupported key type!");
}

// Raises for what is no number and no text that a key can hold.
void CheckKey(lua_State* L, int index) {
    if (lua_type(L, index) == LUA_TNUMBER) return;
    if (lua_type(L, index) != LUA_TSTRING) return RaiseUnsupportedKey(L);
    size_t length;
    const char* text = lua_tolstring(L, index, &length);
    if (length > INT_MAX || TextCell::IsCell(text) || memchr(text, '\0', length)) {
        RaiseUnsupportedKey(L);
    }
}

// A result that owns nothing. It outlives its command, so pushing it needs no protection.
struct SimpleResult {
    void Push(lua_State* L) const;

    bool m_IsThere = false;
    uint32_t m_Flags = SV_Nil;
    uint64_t m_Word = 0;
};

void SimpleResult::Push(lua_State* L) const {
    if (!m_IsThere) return;
    switch (m_Flags & SVF_TypeMask) {
        case SV_Number:
            return lua_pushnumber(L, std::bit_cast<double>(m_Word));
        case SV_Boolean:
            return lua_pushboolean(L, m_Word & 1);
        case SV_Function:
            return PushFunction(L, m_Word, m_Flags & ~SVF_TypeMask);
        default:
            return lua_pushnil(L);
    }
}

// A command on its way: its arguments, and the reply.
class Command {
public:
    // Takes the arguments from the stack, where the key comes first if there is one. False when
    // memory has run out. Raises no error for plain values.
    bool Read(lua_State* L, int first, int count, const Selector& selector);

    // Runs the command; false when there are no results.
    bool Run(RemoteObject& object, int opcode);

    // Pushes the results.
    void Write(RemoteApp* app, lua_State* L) {
        ToLuaRet(app, L, GetResults(), nullptr, nullptr, 0);
    }

    // Takes the results if that can be done without a loss.
    bool TakeSimple(SimpleResult& result);

    // Whether it has left this error with the connection.
    bool HasFailedWith(const char* error) {
        return strcmp(GetResults().FindKeyConst("ErrorString").ToString(""), error) == 0;
    }

private:
    ScriptVal* AddPosition(int position);
    bool RunHere(RemoteObject& object, int opcode);
    ScriptVal& GetResults() { return m_Reply.IsNil() ? m_Args : m_Reply; }

    ScriptArgs m_Args;
    TableEntry** m_Link = &m_Args.m_Value.m_Args.m_Table;
    ScriptVal m_Reply;  // nil for a command within the process, whose results stand in m_Args
};

// Positions come in ascending order. Null without memory.
ScriptVal* Command::AddPosition(int position) {
    TableEntry* entry = NewEntry(static_cast<double>(position));
    if (!entry) return nullptr;
    entry->m_Key.m_Flags |= SVF_Int;
    *m_Link = entry;
    m_Link = &entry->m_Next;
    return &entry->m_Value;
}

bool Command::Read(lua_State* L, int first, int count, const Selector& selector) {
    int position = 1;
    if (selector.m_Kind == Selector::Key) position = 0;
    if (selector.m_Kind == Selector::Function) {
        ScriptVal* function = AddPosition(0);
        if (!function) return false;
        function->Set(SV_Function | (selector.m_Flags & ~SVF_ReadOnly), &selector.m_Function);
    }
    for (int i = 0; i < count; i++) {
        ScriptVal* value = AddPosition(position + i);
        if (!value || !FromLua(L, first + i, *value, nullptr, nullptr, 0)) return false;
    }
    return true;
}

bool Command::Run(RemoteObject& object, int opcode) {
    return object.IsLocal() ? RunHere(object, opcode) : object.DoCommand(opcode, m_Args, m_Reply);
}

// As a connection does for its peer.
bool Command::RunHere(RemoteObject& object, int opcode) {
    ScriptVal value = LocalValue(&object);
    ScriptObject* local = value.ToLocalObject();
    ScriptInfo* info = local ? local->GetScriptInfo() : nullptr;
    ScriptSymbol* symbol =
        info ? info->FindSymbol(nullptr, static_cast<unsigned int>(opcode)) : nullptr;
    if (symbol) {
        symbol->Call(local, m_Args, false);
    } else {
        m_Args.SetError(info ? SCERR_UnknownSymbol : SCERR_InvalidRemoteObject);
    }
    if (object.m_App) object.m_App->KeepError(m_Args);
    return true;
}

bool Command::TakeSimple(SimpleResult& result) {
    const ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    const ScriptVal& results = GetResults();
    if (!Chain::IsList(results) || (config && config->ToLua)) return false;
    // Number keys ascend, so where -1 comes first there is no other result.
    const TableEntry* entry = Chain::Head(results);
    if (!entry) return true;
    const ScriptVal& value = entry->m_Value;
    if (Chain::NumberOf(entry) != -1 || value.HasPayload() || value.IsPointer()) return false;
    result = {true, value.m_Flags, value.IsNil() ? 0 : value.m_Value.m_Word};
    return true;
}

// Keeps a command that is only tried from changing the pending error. One that a command of another
// thread leaves meanwhile stays.
class QuietError {
public:
    QuietError(RemoteApp* app, Command& command, bool isQuiet)
        : m_App(isQuiet ? app : nullptr), m_Command(command) {
        if (m_App) m_Number = m_App->TakeLastError(m_Text);
    }
    QuietError(const QuietError&) = delete;
    QuietError& operator=(const QuietError&) = delete;
    ~QuietError() {
        if (!m_App) return;
        OxStringT<char> text;
        uint32_t number = m_App->TakeLastError(text);
        bool isOfOthers = number && !m_Command.HasFailedWith(text);
        m_App->SetLastError(isOfOthers ? number : m_Number, isOfOthers ? text : m_Text);
    }

private:
    RemoteApp* const m_App;
    Command& m_Command;
    uint32_t m_Number = 0;
    OxStringT<char> m_Text;
};

// Raises the error on top of the stack, with the place in the script where the command stands.
int RaiseHere(lua_State* L) {
    if (lua_type(L, -1) == LUA_TSTRING) {
        luaL_where(L, 1);
        lua_insert(L, -2);
        lua_concat(L, 2);
    }
    return lua_error(L);
}

// Whether values can be read without running a script and without an error.
bool ArePlain(lua_State* L, int first, int count) {
    constexpr size_t kMaxLength = 1 << 20;
    const ScriptConfig* config = g_ScriptConfig.load(std::memory_order_acquire);
    if (config && config->FromLua) return false;
    for (int index = first; index < first + count; index++) {
        int type = lua_type(L, index);
        bool isPlain = type == LUA_TNUMBER || type == LUA_TNIL || type == LUA_TBOOLEAN ||
                       (type == LUA_TSTRING && lua_objlen(L, index) <= kMaxLength);
        if (!isPlain) return false;
    }
    return true;
}

// Sends a command with the `count` values from index `first` on, and pushes its results. Returns
// how many they are.
int Send(lua_State* L, RemoteObject* object, int opcode, int first, int count,
         const Selector& selector = {}, bool isQuiet = false) {
    bool arePlain = ArePlain(L, first, count);
    ProtectedCalls calls(L, LUA_MINSTACK + (arePlain ? 0 : count));
    int top = lua_gettop(L);
    int status = 0;
    bool hasMemory = true;
    SimpleResult simple;
    {
        Held held;
        if (!arePlain || object->IsLocal()) held.Hold(object);
        Command command;
        QuietError quiet(object->m_App, command, isQuiet);
        if (arePlain) {
            hasMemory = command.Read(L, first, count, selector);
        } else {
            status = calls.Call(first, count, 0, [&](lua_State* inner) {
                hasMemory = command.Read(inner, 1, count, selector);
            });
        }
        if (status == 0 && hasMemory && command.Run(*object, opcode) &&
            !command.TakeSimple(simple)) {
            held.Hold(object);
            status = calls.Call(0, 0, LUA_MULTRET,
                                [&](lua_State* inner) { command.Write(object->m_App, inner); });
        }
    }
    if (!hasMemory) return luaL_error(L, "not enough memory");
    if (status != 0) return RaiseHere(L);
    simple.Push(L);
    return lua_gettop(L) - top;
}

// The type

class LuaType_RemoteObject : public LuaTypeT<RemoteObject> {
public:
    using LuaTypeT::LuaTypeT;

    int lw_create(lua_State* L) override;
    int lw_use(lua_State*, void* object, LuaType*) override {
        Held::Use(Self(object));
        return 0;
    }
    int lw_recycle(lua_State*, void* object, LuaType*) override {
        Held::Recycle(Self(object));
        return 0;
    }

    int lw_index(lua_State* L, void* object, LuaType*) override {
        CheckKey(L, 1);
        return Send(L, Self(object), SST_GetTable, 1, 1, {Selector::Key}, IsProbe(L));
    }
    int lw_newindex(lua_State* L, void* object, LuaType*) override {
        CheckKey(L, 1);
        return Send(L, Self(object), SST_SetTable, 1, 2, {Selector::Key});
    }
    int lw_call(lua_State* L, void* object, LuaType*) override {
        return Send(L, Self(object), SST_Call, 2, lua_gettop(L) - 1);
    }
    int lw_tostring(lua_State* L, void* object, LuaType* type) override {
        // Lua raises an error where there is no text.
        int count = Send(L, Self(object), SST_ToString, 0, 0);
        if (count > 0 && lua_type(L, -count) == LUA_TSTRING) return count;
        return LuaTypeT::lw_tostring(L, object, type);
    }
    int lw_unm(lua_State* L, void* object, LuaType*) override {
        return Send(L, Self(object), SST_Unm, 0, 0);
    }

    int lw_add(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_Add);
    }
    int lw_sub(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_Sub);
    }
    int lw_mul(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_Mul);
    }
    int lw_div(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_Div);
    }
    int lw_pow(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_Pow);
    }
    int lw_eq(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_EQ);
    }
    int lw_lt(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_LT);
    }
    int lw_le(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_LE);
    }
    int lw_concat(lua_State* L, void* object, LuaType* type) override {
        return DoOperator(L, Self(object), type, SST_Concat);
    }

    int lwf_SetTimeout(lua_State* L, RemoteObject* object, LuaType* type);
    int lwf_IsAppConnected(lua_State* L, RemoteObject* object, LuaType* type);
    int lwf_GetAppData(lua_State* L, RemoteObject* object, LuaType* type);
    int lwf_SetAppFlags(lua_State* L, RemoteObject* object, LuaType* type);
    int lwf_ClearAppFlags(lua_State* L, RemoteObject* object, LuaType* type);
    int lwf_GetAppFlags(lua_State* L, RemoteObject* object, LuaType* type);
    int lwm_LastError(lua_State* L, RemoteObject* object, LuaType* type, bool set);
    static LuaFuncTable FuncTable[];
    static LuaMemberTable MemberTable[];

private:
    static int DoOperator(lua_State* L, RemoteObject* object, LuaType*, int opcode) {
        return Send(L, object, opcode, 1, 1);
    }
};

// class._ScriptObject(app, low, high, refLow, refHigh)
int LuaType_RemoteObject::lw_create(lua_State* L) {
    lua_settop(L, 5);
    RemoteObject* app = ToScriptObject(L, 1);
    bool hasAddress = lua_tonumber_def(L, 2, 0) != 0 || lua_tonumber_def(L, 3, 0) != 0;
    if (!app || !app->m_App || !hasAddress) return 0;
    bool hasReference = lua_type(L, 4) == LUA_TNUMBER && lua_type(L, 5) == LUA_TNUMBER;
    return Send(L, app, SST_GetObject, 2, hasReference ? 4 : 2);
}

// The connection of an application object. Raises for any other.
//   action  what cannot be done with those
RemoteApp* CheckApp(lua_State* L, RemoteObject* object, const char* action) {
    const LocalObject* local = AsLocalObject(object);
    bool isApp = local ? local->m_IsRoot : object->m_ID == kRootID;
    if (!isApp || !object->m_App) luaL_error(L, "Can only %s application object.", action);
    return object->m_App;
}

int LuaType_RemoteObject::lwf_SetTimeout(lua_State* L, RemoteObject* object, LuaType*) {
    RemoteApp* app = CheckApp(L, object, "set timeout on");
    lua_pushnumber(L, app->GetTimeOut());
    if (lua_type(L, 1) == LUA_TNUMBER) app->SetTimeOut(lua_tonumber(L, 1));
    return 1;
}

int LuaType_RemoteObject::lwf_IsAppConnected(lua_State* L, RemoteObject* object, LuaType*) {
    lua_pushboolean(L, CheckApp(L, object, "check connection on")->Connected());
    return 1;
}

int LuaType_RemoteObject::lwf_GetAppData(lua_State* L, RemoteObject* object, LuaType*) {
    RemoteApp* app = CheckApp(L, object, "get data on");
    ProtectedCalls calls(L);
    int status;
    {
        OxStringT<char> name = app->GetName();
        OxStringT<char> address = app->GetHostName();
        ScriptVal id = app->GetUUID();
        status = calls.Call(0, 0, 1, [&](lua_State* inner) {
            auto set = [inner](const char* field, const char* text) {
                lua_pushstring(inner, text);
                lua_setfield(inner, 1, field);
            };
            lua_createtable(inner, 0, 3);
            set("Name", name);
            set("Address", address);
            set("ID", id.ToString(""));
        });
    }
    return status == 0 ? 1 : lua_error(L);
}

int LuaType_RemoteObject::lwf_SetAppFlags(lua_State* L, RemoteObject* object, LuaType*) {
    RemoteApp* app = CheckApp(L, object, "set flags on");
    app->SetFlags(Low32(lua_tonumber_def(L, 1, 0)));
    return 0;
}

int LuaType_RemoteObject::lwf_ClearAppFlags(lua_State* L, RemoteObject* object, LuaType*) {
    RemoteApp* app = CheckApp(L, object, "clear flags on");
    app->ClearFlags(Low32(lua_tonumber_def(L, 1, 0)));
    return 0;
}

int LuaType_RemoteObject::lwf_GetAppFlags(lua_State* L, RemoteObject* object, LuaType*) {
    RemoteApp* app = CheckApp(L, object, "get flags on");
    if (lua_type(L, 1) == LUA_TNUMBER) {
        lua_pushnumber(L, app->GetFlags() & Low32(lua_tonumber(L, 1)));
    } else {
        lua_pushnil(L);
    }
    return 1;
}

int LuaType_RemoteObject::lwm_LastError(lua_State* L, RemoteObject* object, LuaType*, bool set) {
    if (set) return 0;
    ProtectedCalls calls(L);
    int status = 0;
    {
        OxStringT<char> text;
        bool isPending = object->m_App && object->m_App->TakeLastError(text) != 0;
        status = calls.Call(0, 0, 1, [&](lua_State* inner) {
            if (isPending) lua_pushstring(inner, text);
        });
    }
    return status == 0 ? 1 : lua_error(L);
}

LuaFuncTable LuaType_RemoteObject::FuncTable[] = {
    Func<&LuaType_RemoteObject::lwf_SetTimeout>("SetTimeout"),
    Func<&LuaType_RemoteObject::lwf_SetTimeout>("GetTimeout"),
    Func<&LuaType_RemoteObject::lwf_IsAppConnected>("IsAppConnected"),
    Func<&LuaType_RemoteObject::lwf_GetAppData>("GetAppData"),
    Func<&LuaType_RemoteObject::lwf_SetAppFlags>("SetAppFlags"),
    Func<&LuaType_RemoteObject::lwf_ClearAppFlags>("ClearAppFlags"),
    Func<&LuaType_RemoteObject::lwf_GetAppFlags>("GetAppFlags"),
    {},
};
LuaMemberTable LuaType_RemoteObject::MemberTable[] = {
    Member<&LuaType_RemoteObject::lwm_LastError>("LastError"),
    {},
};

LuaType_RemoteObject s_RemoteObject(kTypeName, &LuaClass::s_LuaType,
                                    LuaType_RemoteObject::FuncTable,
                                    LuaType_RemoteObject::MemberTable);

// What the closure of a function value has as its upvalue.
struct FunctionRecord {
    uint64_t m_Function;
    uint32_t m_Flags;
};

// Pushes the key under which the weak table of local objects has the userdata of a connection for
// an object: the bytes of both addresses.
void PushLocalKey(lua_State* L, RemoteApp* app, ScriptObject* object) {
    const void* key[] = {app, object};
    lua_pushlstring(L, reinterpret_cast<const char*>(key), sizeof(key));
}

// Makes sure that a push has room and all that it needs in the registry.
int PreparePush(lua_State* L) {
    ProtectedCalls calls(L, LUA_MINSTACK);
    return 0;
}

// Whether the value on top of the stack is the userdata of a local object. The address may have
// been that of another one, or the userdata have been let go of.
bool IsUserdataOf(lua_State* L, const ScriptObject* object) {
    RemoteObject* known = ToScriptObject(L, -1);
    return known && LocalValue(known).ToLocalObject() == object;
}

}  // namespace

constinit LuaType& s_LuaType_RemoteObject = s_RemoteObject;

RemoteObject* ToScriptObject(lua_State* L, int index) {
    return static_cast<RemoteObject*>(lua_totype(L, index, kTypeName));
}

void ReadObject(RemoteObject* object, ScriptVal& value) {
    if (object->IsLocal()) {
        value = LocalValue(object);
        return;
    }
    value.Set(SV_RemoteObject, &object);
    if (ScriptObject* local = value.ToLocalObject()) value = local;
}

void PushLocalObject(lua_State* L, RemoteApp* app, const ScriptVal& value) {
    luaL_checkstack(L, LUA_MINSTACK, "pushing an object");
    ScriptObject* object = value.ToLocalObject();
    if (!object) return lua_pushnil(L);
    PushWeakTable(L, reinterpret_cast<void*>(&PushLocalObject));
    int known = lua_gettop(L);
    PushLocalKey(L, app, object);
    lua_rawget(L, known);
    if (IsUserdataOf(L, object)) return lua_replace(L, known);
    lua_settop(L, known);
    ProtectedCalls calls(L);
    int status = LUA_ERRMEM;
    bool isRoot = ExportedValue(app, kRootID).ToLocalObject() == object;
    if (auto* local = new LocalObject(app, value, isRoot)) {
        status = calls.Call(0, 0, 1, [&](lua_State* inner) {
            lua_pushLuaObject(inner, local, &s_LuaType_RemoteObject);
        });
        local->Recycle();
        if (status != 0) lua_error(L);
    }
    if (status != 0) luaL_error(L, "not enough memory");
    PushLocalKey(L, app, object);
    lua_pushvalue(L, -2);
    lua_rawset(L, known);
    lua_replace(L, known);
    lua_settop(L, known);
}

void PushFunction(lua_State* L, uint64_t function, uint32_t flags) {
    auto* record = static_cast<FunctionRecord*>(lua_newuserdata(L, sizeof(FunctionRecord)));
    *record = {function, flags};
    lua_pushcclosure(L, lua_function_call, 1);
}

void _PushScriptObject(lua_State* L, RemoteObject* object, bool keep) {
    if (!object) return lua_pushnil(L);
    auto push = [object](lua_State* inner) {
        if (!object->IsLocal() || AsLocalObject(object)) {
            return lua_pushLuaObject(inner, object, &s_LuaType_RemoteObject);
        }
        // The value is not to be lost to an error.
        ProtectedCalls calls(inner);
        int status;
        {
            ScriptVal value = ExportedValue(object->m_App, object->m_ID);
            status = calls.Call(0, 0, 1, [&](lua_State* innermost) {
                PushLocalObject(innermost, object->m_App, value);
            });
        }
        if (status != 0) lua_error(inner);
        calls.Leave();
    };
    if (keep) return push(L);
    if (lua_cpcall(L, PreparePush, nullptr) != 0) {
        object->DecRef();
        lua_error(L);
    }
    ProtectedCalls calls(L);
    int status = calls.Call(0, 0, 1, push);
    object->DecRef();
    if (status != 0) lua_error(L);
    calls.Leave();
}

}  // namespace Korvel

extern "C" int Korvel::lua_function_call(lua_State* L) {
    using namespace Korvel;
    auto* record = static_cast<FunctionRecord*>(lua_touserdata(L, lua_upvalueindex(1)));
    RemoteObject* object = ToScriptObject(L, 1);
    // The debug library gives scripts a way to put something else in its place.
    bool isRecord = record && lua_objlen(L, lua_upvalueindex(1)) == sizeof(FunctionRecord);
    if (!isRecord || !object) return 0;
    return CallOut(L, [&] {
        return Send(L, object, SST_CallFunction, 2, lua_gettop(L) - 1,
                    {Selector::Function, record->m_Function, record->m_Flags});
    });
}
