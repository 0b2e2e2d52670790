#pragma once

#include <cstdint>
#include <typeinfo>

#include "core/ScriptVal.h"

namespace Korvel {

class RemoteApp;

// An object that is known on a connection, under a number that both sides use. On the side of its
// owner (`is local`) the record is the entry of an exported object, on the other side it is the
// object's proxy. Number 1 is the application's object.
//
// Lifetime: a record stays in its place in its connection's tables; number 0 marks one that is
//           free. While its count is above 0 it holds a use of the connection. A count that has
//           reached 0xFFFFFFFF stays there.
// Threads:  the fields are guarded by the connection's lock; the operations are for any thread that
//           holds a count.
class KORVEL_EXPORT RemoteObject {
public:
    void IncRef();  // nothing on a record without a connection
    void DecRef();
    bool IsLocal() const { return m_IsLocal; }

    // Sends a command to the object and waits for the reply, whose table is the result. Nil, and
    // false, when there was none.
    ScriptVal DoCommand(int op, ScriptArgs& args);
    bool DoCommand(int op, ScriptArgs& args, ScriptVal& result);

    // Sends a command; the callback gets the reply as a packet. Returns the request's number, 0
    // when nothing could be sent.
    uint32_t DoCommandAsync(int op, ScriptArgs& args, AsyncCallback callback, void* data);

    uint32_t m_Count;  // references held through this record
    uint32_t m_ID;
    ScriptObject* m_Object;  // of a proxy only where a process is connected to itself
    RemoteApp* m_App;        // null in the process's own table
    const std::type_info* m_Type;
    bool m_IsLocal;
};

}  // namespace Korvel
