// Who is there, by datagram. Hosts tell whatever they like of themselves, and anybody may ask
// anything: an answer fits into a datagram, and whoever asked can read it. What claims to be an
// answer may be anything, too.
#include <cmath>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <string_view>
#include <vector>

#include "core/ScriptTextInternal.h"
#include "remote/ServerDiscoveryInternal.h"

using namespace Korvel;

namespace {

void Check(bool holds) {
    if (!holds) abort();
}

// A value as a host would send it; what is none of its kind is a nil.
ScriptVal TakeValue(std::string_view& input) {
    if (input.empty()) return {};
    size_t length = std::min<size_t>(static_cast<unsigned char>(input[0]) * 8, input.size() - 1);
    std::vector<unsigned char> bytes(input.begin() + 1,
                                     input.begin() + 1 + static_cast<std::ptrdiff_t>(length));
    input.remove_prefix(1 + length);
    ScriptVal value;
    unsigned char* cursor = bytes.data();
    value.FromPkt(nullptr, cursor, bytes.data() + bytes.size());
    return value;
}

ScriptVal ReadAnswer(const std::string& answer) {
    ScriptVal table;
    Check(FromForeignText(table, answer.c_str() + kMagicSize, nullptr, 0) && table.IsTable());
    return table;
}

void CheckAnswer(const std::string& answer, const ScriptVal& machine, const char* name) {
    Check(answer.size() <= kMaxDatagram && answer.starts_with("RSP:{"));
    Check(strlen(answer.c_str()) == answer.size() - 1);
    ScriptVal table = ReadAnswer(answer);
    Check(table["Version"] == machine["Version"] && table["Platform"] == machine["Platform"]);
    Check(table["Truncated"].IsNil() || table["Truncated"] == true);
    Check(!table.GetConstructor());
    if (*name) {
        Check(table["Type"] == name || table["Truncated"] == true);
    } else {
        Check(table["Hosts"].IsTable());
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    std::string_view input(reinterpret_cast<const char*>(data), size);
    ScriptVal machine(SV_Table, nullptr);
    machine["Version"] = "18.0";
    machine["HostName"] = "machine";
    machine["Platform"] = "Linux";

    HostRegistry registry;
    ptr<RemoteApp> app(new RemoteApp("fuzz", 0, nullptr));
    std::vector<std::string> names = {""};
    size_t numHosts = input.empty() ? 0 : static_cast<size_t>(input[0] & 7);
    if (!input.empty()) input.remove_prefix(1);
    ScriptVal user = TakeValue(input);
    if (user.IsString()) machine["UserName"] = user;
    for (size_t i = 0; i < numHosts; i++) {
        ScriptHost host;
        if (!HostRegistry::MakeHost(TakeValue(input), app.Get(), host)) continue;
        names.push_back(host.m_Name);
        if (!registry.Add(host)) continue;
        registry.SetPingInfo(names.size() - 1, HostRegistry::CleanInfo(TakeValue(input)));
        registry.Find(names.back().c_str(), TakeValue(input), TakeValue(input));
    }
    for (const std::string& name : names) {
        std::string answer = AnswerDatagram(registry, "SPP:" + name, machine);
        Check(!answer.empty());
        CheckAnswer(answer, machine, name.c_str());
    }
    std::string answer = AnswerDatagram(registry, input, machine);
    if (!answer.empty()) ReadAnswer(answer);

    // The other side.
    ScriptVal table;
    FromForeignText(table, std::string(input).c_str(), nullptr, 0);
    return 0;
}
