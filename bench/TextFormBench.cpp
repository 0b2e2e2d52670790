// The text form of values beside JSON by nlohmann: a table of settings, texts, numbers, booleans
// and tables by turns, of 1,000 entries and of 10 MiB.
#include "TextFormBench.h"

#include <cmath>
#include <cstdlib>
#include <string>

#include "Compare.h"

namespace {

using Json = nlohmann::json;
using Korvel::OxStringT;
using Korvel::ScriptVal;

constexpr int kKinds = 8;

ScriptVal OwnEntry(int i) {
    switch (i % kKinds) {
        case 0:
            return "a value of some length";
        case 1:
            return i * 37;
        case 2:
            return i * 0.25;
        case 3:
            return i % 16 < 8;
        case 4: {
            ScriptVal colour(Korvel::SV_Table, nullptr);
            colour["R"] = 0.5;
            colour["G"] = (i % 100) / 100.0;
            colour["B"] = 1.0;
            return colour;
        }
        case 5:
            return "C:\\Media\\\"New\" clips\\intro.mov";
        case 6:
            return std::sqrt(i);
        default: {
            ScriptVal list(Korvel::SV_Table, nullptr);
            for (int k = 1; k <= 4; k++) list.FindKey(k, Korvel::SVF_Int, Korvel::SVF_Int) = i + k;
            return list;
        }
    }
}

Json JsonEntry(int i) {
    switch (i % kKinds) {
        case 0:
            return "a value of some length";
        case 1:
            return i * 37;
        case 2:
            return i * 0.25;
        case 3:
            return i % 16 < 8;
        case 4:
            return {{"R", 0.5}, {"G", (i % 100) / 100.0}, {"B", 1.0}};
        case 5:
            return "C:\\Media\\\"New\" clips\\intro.mov";
        case 6:
            return std::sqrt(i);
        default:
            return {i + 1, i + 2, i + 3, i + 4};
    }
}

std::string NameOf(int i) {
    static const char* const names[] = {"Title", "Width",    "Gain",   "IsOpen",
                                        "Back",  "LastFile", "Factor", "Order"};
    std::string name(names[i % kKinds]);
    return name += std::to_string(i);
}

}  // namespace

ScriptVal Korvel::Bench::OwnSettings(int count) {
    ScriptVal settings(Korvel::SV_Table, nullptr);
    for (int i = 0; i < count; i++) settings.AddKey(NameOf(i).c_str()) = OwnEntry(i);
    return settings;
}

Json Korvel::Bench::JsonSettings(int count) {
    Json settings = Json::object();
    for (int i = 0; i < count; i++) settings[NameOf(i)] = JsonEntry(i);
    return settings;
}

namespace {

using Korvel::Bench::JsonSettings;
using Korvel::Bench::OwnSettings;

void WriteOwn(benchmark::State& state, const ScriptVal& settings, unsigned int options) {
    int64_t bytes = 0;
    for (auto _ : state) {
        OxStringT<char> text;
        if (!settings.ToText(text, 0, options)) abort();
        bytes += text.GetLength();
    }
    state.SetBytesProcessed(bytes);
}

void WriteJson(benchmark::State& state, const Json& settings, bool isCompact) {
    int64_t bytes = 0;
    for (auto _ : state) {
        std::string text = isCompact ? settings.dump() : settings.dump(1, '\t');
        benchmark::DoNotOptimize(text.data());
        bytes += static_cast<int64_t>(text.size());
    }
    state.SetBytesProcessed(bytes);
}

void AddWriting(const std::string& size, int count) {
    for (bool isCompact : {false, true}) {
        std::string row = "write " + size + (isCompact ? ", one line" : ", lines");
        unsigned int options = isCompact ? Korvel::TXT_Compact : 0u;
        benchmark::RegisterBenchmark((row + "@korvel").c_str(), [settings = OwnSettings(count),
                                                                 options](benchmark::State& state) {
            WriteOwn(state, settings, options);
        });
        benchmark::RegisterBenchmark(
            (row + "@nlohmann").c_str(),
            [settings = JsonSettings(count), isCompact](benchmark::State& state) {
                WriteJson(state, settings, isCompact);
            });
    }
}

// As many entries as take 10 MiB of text.
int CountForLargeText() {
    constexpr int kSample = 8000;
    return static_cast<int>((10ll << 20) * kSample / OwnSettings(kSample).ToTextLen(0, 0));
}

}  // namespace

int main(int argc, char** argv) {
    AddWriting("1,000 entries", 1000);
    AddWriting("10 MiB", CountForLargeText());
    Korvel::Bench::AddReading();
    return Korvel::Bench::RunComparison(argc, argv);
}
