#include <algorithm>
#include <cmath>
#include <cstring>
#include <string_view>
#include <utility>

#include "core/ScriptValInternal.h"
#include "remote/HostRegistryInternal.h"

namespace Korvel {
namespace {

// Tables in one another, that which goes to anybody among them.
constexpr int kMostCleanNesting = 4;

bool IsCleanKey(const ScriptVal& key) {
    if (key.IsNumber()) return std::isfinite(key.ToNumber());
    // These are not entries in the text form: they change the table that they stand in.
    return key.IsString() && key != "__ctor" && key != "__flags";
}

// Makes a copy without flags and constructors. False for what is left out.
bool CopyClean(const ScriptVal& value, int nesting, ScriptVal& copy) {
    if (value.IsNumber() ? std::isfinite(value.ToNumber())
                         : value.IsString() || value.IsBoolean() || value.IsMemBlock()) {
        copy = value;
        return true;
    }
    if (!value.IsTable() || value.GetConstructor() || nesting == 0) return false;
    copy = ScriptVal(SV_Table, nullptr);
    for (TableEntry* entry = nullptr; value.NextKey(entry);) {
        ScriptVal inner;
        if (!IsCleanKey(entry->m_Key) || !CopyClean(entry->m_Value, nesting - 1, inner)) continue;
        TableEntry* added = NewEntry(entry->m_Key);
        if (!added) break;
        added->m_Value = std::move(inner);
        Chain::Append(copy, added);
    }
    return true;
}

// A text that is not empty; null for all else, which counts as not given.
const char* GivenText(const ScriptVal& value) {
    const char* text = value.ToString("");
    return *text ? text : nullptr;
}

bool HasName(const ScriptHost& host, const char* name) {
    return strcmp(host.m_Name, name) == 0;
}

}  // namespace

// Making

uint64_t HostRegistry::ToProcessID(const ScriptVal& value) {
    unsigned long long id = 0;
    value.To(id);
    return id;
}

ScriptVal HostRegistry::CleanInfo(const ScriptVal& info) {
    uint32_t size = info.IsTable() ? info.CalcPktSize() : 0;
    ScriptVal clean;
    if (size > 0 && size <= kMostInfoBytes) CopyClean(info, kMostCleanNesting, clean);
    return clean;
}

bool HostRegistry::MakeHost(const ScriptVal& info, RemoteApp* app, ScriptHost& host) {
    if (!info.IsTable() || !info.FindKeyConst("Name").IsString()) return false;
    host.m_NumBytes = info.CalcPktSize();
    if (host.m_NumBytes == 0 || host.m_NumBytes > kMostInfoBytes) return false;
    host.m_App = ptr<RemoteApp>::Share(app);
    host.m_Info = info;
    host.m_Name = host.m_Info.FindKeyConst("Name").ToString("");
    host.m_UUID = info.FindKeyConst("UUID");
    host.m_ProcessID = ToProcessID(info.FindKeyConst("ProcessID"));
    long long port = info.FindKeyConst("Port").ToInteger(0);
    host.m_Port = static_cast<uint32_t>(std::clamp<long long>(port, 0, UINT32_MAX));
    host.m_PingInfo = CleanInfo(info.FindKeyConst("PingInfo"));
    return true;
}

bool HostRegistry::Add(ScriptHost& host) {
    KorvelScript::AutoLock guard(m_Lock);
    size_t numHosts = 0;
    uint64_t numBytes = host.m_NumBytes;
    for (const ScriptHost& other : m_Hosts) {
        if (other.m_App.Get() != host.m_App.Get()) continue;
        numHosts++;
        numBytes += other.m_NumBytes;
    }
    if (m_Hosts.size() >= kMostHosts || numHosts >= kMostHostsOfOne || numBytes > kMostBytesOfOne) {
        return false;
    }
    host.m_Serial = ++m_LastSerial;
    m_Hosts.push_back(std::move(host));
    return true;
}

HostRegistry::Hosts HostRegistry::Remove(uint64_t processID) {
    Hosts removed;
    KorvelScript::AutoLock guard(m_Lock);
    auto found = std::find_if(m_Hosts.begin(), m_Hosts.end(), [=](const ScriptHost& host) {
        return host.m_ProcessID == processID;
    });
    if (found != m_Hosts.end()) removed.splice(removed.end(), m_Hosts, found);
    return removed;
}

HostRegistry::Hosts HostRegistry::RemoveAllOf(const RemoteApp* app) {
    Hosts removed;
    KorvelScript::AutoLock guard(m_Lock);
    for (auto next = m_Hosts.begin(); next != m_Hosts.end();) {
        auto host = next++;
        if (host->m_App.Get() == app) removed.splice(removed.end(), m_Hosts, host);
    }
    return removed;
}

// Looking up

ScriptVal HostRegistry::Find(const char* name, const ScriptVal& uuid,
                             const ScriptVal& priorityKey) const {
    const char* wantedUUID = GivenText(uuid);
    const char* key = GivenText(priorityKey);
    const ScriptHost* best = nullptr;
    double highest = 0;
    KorvelScript::AutoLock guard(m_Lock);
    for (const ScriptHost& host : m_Hosts) {
        if (!HasName(host, name) || (wantedUUID && host.m_UUID != wantedUUID)) continue;
        if (!host.m_App->Connected()) continue;
        if (!key) return host.m_Info;
        const ScriptVal& priority = host.m_Info.FindKeyConst("Priorities").FindKeyConst(key);
        double number = priority.ToNumber(NAN);
        if (std::isnan(number) || (best && number <= highest)) continue;
        best = &host;
        highest = number;
    }
    return best ? best->m_Info : ScriptVal();
}

ScriptVal HostRegistry::ListInfos() const {
    ScriptVal list(SV_Table, nullptr);
    int number = 0;
    KorvelScript::AutoLock guard(m_Lock);
    for (const ScriptHost& host : m_Hosts) {
        if (host.m_App->Connected()) list[++number] = host.m_Info;
    }
    return list;
}

const ScriptHost* HostRegistry::FindNameLocked(const char* name, bool mustBeConnected) const {
    for (const ScriptHost& host : m_Hosts) {
        if (!HasName(host, name)) continue;
        if (!mustBeConnected || host.m_App->Connected()) return &host;
    }
    return nullptr;
}

bool HostRegistry::FindProcess(const char* name, uint64_t& processID) const {
    KorvelScript::AutoLock guard(m_Lock);
    const ScriptHost* host = FindNameLocked(name, true);
    if (host) processID = host->m_ProcessID;
    return host != nullptr;
}

std::vector<ScriptVal> HostRegistry::GetProxies(const RemoteApp* butOf) const {
    std::vector<ScriptVal> proxies;
    KorvelScript::AutoLock guard(m_Lock);
    for (const ScriptHost& host : m_Hosts) {
        if (host.m_App.Get() != butOf) proxies.push_back(host.m_Proxy);
    }
    return proxies;
}

// What hosts tell of themselves

std::vector<HostRegistry::DuePing> HostRegistry::TakeDuePings(int64_t nowMs) {
    std::vector<DuePing> due;
    KorvelScript::AutoLock guard(m_Lock);
    for (ScriptHost& host : m_Hosts) {
        if (host.m_LastPingMs && nowMs - host.m_LastPingMs <= kPingIntervalMs) continue;
        host.m_LastPingMs = nowMs;
        due.push_back({host.m_Serial, host.m_Proxy});
    }
    return due;
}

void HostRegistry::SetPingInfo(uint64_t serial, ScriptVal info) {
    if (!info.IsTable()) return;
    KorvelScript::AutoLock guard(m_Lock);
    for (ScriptHost& host : m_Hosts) {
        if (host.m_Serial == serial) return std::swap(host.m_PingInfo, info);
    }
}

bool HostRegistry::GetPingInfo(const char* name, ScriptVal& info) const {
    KorvelScript::AutoLock guard(m_Lock);
    const ScriptHost* host = FindNameLocked(name, false);
    if (host) info = host->m_PingInfo;
    return host != nullptr;
}

bool HostRegistry::ListNames(size_t maxBytes, std::vector<std::string>& names) const {
    bool isWhole = true;
    KorvelScript::AutoLock guard(m_Lock);
    for (const ScriptHost& host : m_Hosts) {
        size_t length = strnlen(host.m_Name, maxBytes + 1);
        if (length > maxBytes) {
            isWhole = false;
            continue;
        }
        maxBytes -= std::max<size_t>(length, 1);  // an empty one takes room, too
        names.emplace_back(host.m_Name, length);
    }
    return isWhole;
}

}  // namespace Korvel
