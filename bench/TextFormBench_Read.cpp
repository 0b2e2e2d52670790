// Texts of values read back, beside nlohmann's parser and beside the distribution's Lua: it loads
// the same text, collects in full and walks the table, in a process of its own that takes the time
// around that. What the making and the end of a state cost is in our time and not in its; the end
// of the value is in neither.
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "Compare.h"
#include "TextFormBench.h"

namespace Korvel::Bench {
namespace {

using Json = nlohmann::json;

// The best of a few turns, in seconds.
constexpr const char* kProgram =
    " local text = ... "
    "local function walk(t) for k, v in pairs(t) do if type(v) == 'table' then walk(v) end end end "
    "local best = 1e9 for i = 1, 5 do collectgarbage() local t = os.clock() "
    "local value = loadstring(text)() collectgarbage() walk(value) "
    "t = os.clock() - t if t < best then best = t end end io.write(best)";

// A large text is one of sections with the same names: another Lua takes no more than 262,143
// different constants.
ScriptVal OwnSections(int sections) {
    ScriptVal settings = OwnSettings(1000);
    if (sections == 1) return settings;
    ScriptVal all(SV_Table, nullptr);
    for (int i = 0; i < sections; i++) {
        all.AddKey(("Section" + std::to_string(i)).c_str()) = settings;
    }
    return all;
}

Json JsonSections(int sections) {
    Json settings = JsonSettings(1000);
    if (sections == 1) return settings;
    Json all = Json::object();
    for (int i = 0; i < sections; i++) all["Section" + std::to_string(i)] = settings;
    return all;
}

using Clock = std::chrono::steady_clock;

void SetTime(benchmark::State& state, Clock::time_point start) {
    state.SetIterationTime(std::chrono::duration<double>(Clock::now() - start).count());
}

void ReadOwn(benchmark::State& state, const std::string& text) {
    for (auto _ : state) {
        ScriptVal value;
        auto start = Clock::now();
        if (!value.FromText(text.c_str())) abort();
        SetTime(state, start);
    }
    state.SetBytesProcessed(static_cast<int64_t>(text.size() * state.iterations()));
}

void ReadJson(benchmark::State& state, const std::string& text) {
    for (auto _ : state) {
        auto start = Clock::now();
        Json value = Json::parse(text);
        SetTime(state, start);
    }
    state.SetBytesProcessed(static_cast<int64_t>(text.size() * state.iterations()));
}

// Seconds; less than 0 when the program did not run.
double RunLua(const std::string& file) {
    std::string command = "'" LUA51 "' '" + file;
    command += "'";
    FILE* pipe = popen(command.c_str(), "r");
    double seconds = -1;
    if (!pipe) return seconds;
    if (fscanf(pipe, "%lf", &seconds) != 1) seconds = -1;
    pclose(pipe);
    return seconds;
}

void ReadLua(benchmark::State& state, const std::string& text) {
    char name[] = "/tmp/textform_bench_XXXXXX";
    int descriptor = mkstemp(name);
    FILE* file = descriptor < 0 ? nullptr : fdopen(descriptor, "w");
    if (!file) return state.SkipWithError("no file");
    fprintf(file, "(function(...)%s end)([==[return %s]==])", kProgram, text.c_str());
    fclose(file);
    for (auto _ : state) {
        double seconds = RunLua(name);
        if (seconds < 0) {
            state.SkipWithError("the program did not run");
            break;
        }
        state.SetIterationTime(seconds);
    }
    remove(name);
}

void AddRow(const std::string& size, int sections, int turns) {
    OxStringT<char> written;
    if (!OwnSections(sections).ToText(written, 0, 0)) abort();
    std::string text(written);
    std::string json = JsonSections(sections).dump(1, '\t');
    std::string row = "read " + size;
    auto add = [&](const char* name, auto read, const std::string& input) {
        benchmark::RegisterBenchmark((row + name).c_str(), read, input)
            ->UseManualTime()
            ->Iterations(turns);
    };
    add("@korvel", ReadOwn, text);
    add("@nlohmann", ReadJson, json);
    if (*LUA51) add("@lua5.1", ReadLua, text);
}

}  // namespace

void AddReading() {
    AddRow("1,000 entries", 1, 50);
    AddRow("10 MiB", (10 << 20) / OwnSettings(1000).ToTextLen(1, 0), 3);
}

}  // namespace Korvel::Bench
