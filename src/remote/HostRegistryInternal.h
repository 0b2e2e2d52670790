#pragma once

#include <cstdint>
#include <list>
#include <string>
#include <vector>

#include "Platform/Lock.h"
#include "core/Annotations.h"
#include "core/RefObject.h"
#include "core/ScriptVal.h"
#include "remote/RemoteApp.h"

namespace Korvel {

// One host that has registered.
struct ScriptHost {
    OxStringT<char> GetPrintName() const { return RemoteApp::CutName(m_Name); }

    uint64_t m_Serial = 0;  // tells it from one that came later, wherever either lies
    ptr<RemoteApp> m_App;   // on which it has registered
    ScriptVal m_Proxy;      // its application object
    ScriptVal m_Info;       // what it has told of itself
    ScriptVal m_PingInfo;   // what it tells of itself now and then, fit for anybody; a table or nil
    const char* m_Name = nullptr;  // stands in m_Info
    ScriptVal m_UUID;
    uint64_t m_ProcessID = 0;
    uint32_t m_Port = 0;
    int64_t m_LastPingMs = 0;  // 0 for never
    uint32_t m_NumBytes = 0;   // of m_Info
};

// The hosts of a script server, the oldest first. There is no check for duplicates: a process may
// register twice, and two hosts may share a name.
//
// Threads: any. The lock comes before those of connections. Under it nothing is sent and nothing
//          destroyed: what is taken out is handed to the caller.
// Limits:  what one connection may register, since whoever reaches the port may do so.
class HostRegistry {
public:
    static constexpr size_t kMostHosts = 16384;
    static constexpr size_t kMostHostsOfOne = 1024;
    static constexpr uint32_t kMostInfoBytes = 65536;  // as on the wire
    static constexpr uint32_t kMostBytesOfOne = 1 << 20;
    static constexpr int64_t kPingIntervalMs = 10000;

    // A host from the table that it tells of itself. False for what is no table, has no text
    // "Name", or is too large.
    static bool MakeHost(const ScriptVal& info, RemoteApp* app, ScriptHost& host);
    // The process id that a value is; 0 for what is none.
    static uint64_t ToProcessID(const ScriptVal& value);
    // What of a table may go to anybody who asks: numbers, texts, booleans, blocks of bytes, and
    // tables of them. A nil when nothing of it may, or when it is too large.
    static ScriptVal CleanInfo(const ScriptVal& info);

    bool Add(ScriptHost& host);  // takes it over; false when there are too many

    using Hosts = std::list<ScriptHost>;
    Hosts Remove(uint64_t processID);         // the first of this process
    Hosts RemoveAllOf(const RemoteApp* app);  // those of a connection

    // The info of the host that a client asks for; nil for none. It is connected, has the name,
    // the UUID, unless that is empty or no text, and the highest number under the key in the
    // table "Priorities" of its info; without a key, the oldest one is taken.
    ScriptVal Find(const char* name, const ScriptVal& uuid, const ScriptVal& priorityKey) const;
    ScriptVal ListInfos() const;                                    // of connected hosts
    bool FindProcess(const char* name, uint64_t& processID) const;  // of a connected host

    std::vector<ScriptVal> GetProxies(const RemoteApp* butOf) const;

    // Those who are to be asked how they do, which are then taken for asked.
    struct DuePing {
        uint64_t m_Serial;
        ScriptVal m_Proxy;
    };
    std::vector<DuePing> TakeDuePings(int64_t nowMs);
    void SetPingInfo(uint64_t serial, ScriptVal info);  // of CleanInfo

    // Of the oldest host of a name, connected or not. False when there is none.
    bool GetPingInfo(const char* name, ScriptVal& info) const;
    // Names of all hosts, connected or not, as many as have `maxBytes` together; false when there
    // are more.
    bool ListNames(size_t maxBytes, std::vector<std::string>& names) const;

private:
    const ScriptHost* FindNameLocked(const char* name, bool mustBeConnected) const
        KORVEL_REQUIRES(m_Lock);

    mutable KorvelScript::Lock m_Lock;
    Hosts m_Hosts KORVEL_GUARDED_BY(m_Lock);
    uint64_t m_LastSerial KORVEL_GUARDED_BY(m_Lock) = 0;
};

}  // namespace Korvel
