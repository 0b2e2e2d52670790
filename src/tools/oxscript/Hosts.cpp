#include "tools/oxscript/Hosts.h"

#include <algorithm>
#include <array>
#include <cstdio>
#include <set>
#include <thread>
#include <tuple>

#include "Platform/Strings.h"
#include "core/ScriptVal.h"
#include "diag/Env.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "tools/oxscript/Options.h"

namespace Korvel::Oxscript {
namespace {

constexpr double kPingSeconds = 1;
constexpr double kServerSeconds = 3;  // for each exchange with a script server
constexpr unsigned int kEverybody = 0xFFFFFFFF;

// A host and where it is.
struct Place {
    Host m_Host;
    std::string m_User;
    std::string m_Machine;
    std::string m_Address;
};

std::string TextOf(const ScriptVal& table, const char* key) {
    return table.FindKeyConst(key).ToString("");
}

// The answers of the servers of this machine and of all in reach. A server that listens at one
// address alone does not hear a broadcast, and a machine may have no network.
std::vector<ScriptVal> FindServers() {
    ScriptVal own, others;
    const unsigned int thisMachine = RemoteApp::IPFromStr(GetThisMachine().c_str());
    std::thread broadcast([&] { Ping("", kPingSeconds, others, kEverybody); });
    Ping("", kPingSeconds, own, thisMachine);
    broadcast.join();
    std::vector<ScriptVal> servers;
    std::set<std::string> addresses;
    for (const ScriptVal* answers : {&own, &others}) {
        for (TableEntry* entry = nullptr; answers->NextKey(entry);) {
            const ScriptVal& answer = entry->m_Value;
            if (addresses.insert(TextOf(answer, "IP")).second) servers.push_back(answer);
        }
    }
    return servers;
}

std::vector<Place> FindPlaces(const std::vector<ScriptVal>& servers) {
    std::vector<Place> places;
    std::set<std::string> known;  // the server of this machine answers at several addresses
    for (const ScriptVal& server : servers) {
        std::string address = TextOf(server, "IP");
        auto hosts = AskServer(address.c_str());
        if (!hosts) {
            fprintf(stderr, "%sthe script server at %s does not tell its hosts\n", kPrefix,
                    Clean(address).c_str());
            continue;
        }
        for (Host& host : *hosts) {
            if (!host.m_UUID.empty() && !known.insert(host.m_UUID).second) continue;
            places.push_back(
                {std::move(host), TextOf(server, "UserName"), TextOf(server, "HostName"), address});
        }
    }
    std::sort(places.begin(), places.end(), [](const Place& a, const Place& b) {
        return std::tie(a.m_Machine, a.m_Host.m_Name, a.m_Host.m_ProcessID) <
               std::tie(b.m_Machine, b.m_Host.m_Name, b.m_Host.m_ProcessID);
    });
    return places;
}

// JSON shows all characters, and has no place for what is none.
std::string ToUTF8(const std::string& text) {
    return Platform::IsUTF8(text.c_str()) ? text : Clean(text);
}

void PrintJSON(const std::vector<Place>& places) {
    ScriptVal list(SV_Table, nullptr);
    for (size_t i = 0; i < places.size(); i++) {
        const Place& place = places[i];
        ScriptVal& row = list[i + 1] = SV_Table;
        row["Name"] = ToUTF8(place.m_Host.m_Name).c_str();
        row["ProcessID"] = place.m_Host.m_ProcessID;
        row["Port"] = place.m_Host.m_Port;
        row["UserName"] = ToUTF8(place.m_User).c_str();
        row["HostName"] = ToUTF8(place.m_Machine).c_str();
        row["IP"] = place.m_Address.c_str();
    }
    OxStringT<char> text;
    if (!places.empty()) list.ToJSON(text);
    puts(places.empty() ? "[]" : static_cast<const char*>(text));
}

// In characters, as far as the bytes tell.
size_t WidthOf(const std::string& text) {
    return static_cast<size_t>(
        std::count_if(text.begin(), text.end(), [](char c) { return (c & 0xC0) != 0x80; }));
}

std::string Whole(double number) {
    char text[32];
    snprintf(text, sizeof(text), "%.0f", number);
    return text;
}

void PrintTable(const std::vector<Place>& places) {
    constexpr size_t kNumColumns = 5;
    using Row = std::array<std::string, kNumColumns>;
    std::vector<Row> rows = {{"NAME", "PROCESS", "PORT", "USER", "MACHINE"}};
    for (const Place& place : places) {
        rows.push_back({Clean(place.m_Host.m_Name), Whole(place.m_Host.m_ProcessID),
                        Whole(place.m_Host.m_Port), Clean(place.m_User), Clean(place.m_Machine)});
    }
    Row::size_type widths[kNumColumns] = {};
    for (const Row& row : rows) {
        for (size_t i = 0; i < kNumColumns; i++) widths[i] = std::max(widths[i], WidthOf(row[i]));
    }
    for (const Row& row : rows) {
        std::string line;
        for (size_t i = 0; i < kNumColumns; i++) {
            line += row[i];
            if (i + 1 < kNumColumns) line.append(widths[i] - WidthOf(row[i]) + 2, ' ');
        }
        puts(line.c_str());
    }
}

}  // namespace

std::string GetThisMachine() {
    static EnvString s_Address("KORVEL_ListenAddress", false, "");
    OxStringT<char> text;
    s_Address.Get(text);
    bool isOne = !text.IsEmpty() && RemoteApp::IPFromStr(text);
    return isOne ? static_cast<const char*>(text) : "127.0.0.1";
}

std::optional<std::vector<Host>> AskServer(const char* address) {
    ScriptVal server = ScriptApp("", nullptr, ScriptVal(), address, kServerSeconds);
    ScriptVal list = server.CallMember("GetHostList");
    if (!list.IsTable()) return std::nullopt;
    std::vector<Host> hosts;
    for (TableEntry* entry = nullptr; list.NextKey(entry);) {
        const ScriptVal& info = entry->m_Value;
        if (!info.IsTable()) continue;
        hosts.push_back({TextOf(info, "Name"), TextOf(info, "UUID"),
                         info.FindKeyConst("ProcessID").ToNumber(0),
                         info.FindKeyConst("Port").ToNumber(0)});
    }
    return hosts;
}

std::string Clean(const std::string& text) {
    std::string clean;
    bool isUTF8 = Platform::IsUTF8(text.c_str());
    for (size_t i = 0; i < text.size(); i++) {
        auto byte = static_cast<unsigned char>(text[i]);
        // Control characters stand from U+0080 to U+009F, too.
        bool isHigh = isUTF8 && byte == 0xC2 && static_cast<unsigned char>(text[i + 1]) < 0xA0;
        bool isBad = byte < ' ' || byte == 0x7F || isHigh || (!isUTF8 && byte > 0x7F);
        clean += isBad ? '?' : text[i];
        i += isHigh;
    }
    return clean;
}

int ListHosts(bool asJSON) {
    std::vector<ScriptVal> servers = FindServers();
    std::vector<Place> places = FindPlaces(servers);
    if (asJSON) {
        PrintJSON(places);
    } else if (!places.empty()) {
        PrintTable(places);
    } else if (servers.empty()) {
        fprintf(stderr, "%sno script server answers, so no host runs here or in reach\n", kPrefix);
    } else {
        fprintf(stderr, "%sno host is registered\n", kPrefix);
    }
    return 0;
}

}  // namespace Korvel::Oxscript
