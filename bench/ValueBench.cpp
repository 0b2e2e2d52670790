// Tables beside the values of JSON libraries and std::unordered_map: nanoseconds a key to build, to
// copy deeply and to destroy them, and nanoseconds a look-up. Number keys stand beside JSON arrays.
// The rows of text keys show where a chain without an index grows worse than linearly.
#include <algorithm>
#include <chrono>
#include <functional>
#include <nlohmann/json.hpp>
#include <random>
#include <string>
#include <type_traits>
#include <unordered_map>
#include <vector>

#include "Compare.h"
#include "core/ScriptVal.h"

#ifdef KORVEL_RAPIDJSON
#include <rapidjson/document.h>
#endif

namespace {

using Korvel::ScriptVal;
using Numbers = std::vector<int>;  // 1 to n
using Texts = std::vector<std::string>;

struct Own {
    using Table = ScriptVal;
    static void Build(Table& table, const Numbers& keys) {
        table = Korvel::SV_Table;
        for (int key : keys) table.FindKey(key, Korvel::SVF_Int, Korvel::SVF_Int) = key * 0.5;
    }
    static void Build(Table& table, const Texts& keys) {
        table = Korvel::SV_Table;
        for (const std::string& key : keys) table.FindKey(key.c_str()) = 0.5;
    }
    static void Copy(Table& copy, const Table& table) { copy = table; }
    static void Destroy(Table& table) { table.CleanUp(); }
    static double LookUp(const Table& table, int key) { return table.FindKeyConst(key).ToNumber(); }
    using Key = ScriptVal;
    static double LookUp(const Table& table, const Key& key) {
        return table.FindKeyConst(key).ToNumber();
    }
    static double LookUp(const Table& table, const char* key) {
        return table.FindKeyConst(key).ToNumber();
    }
};

// Text keys of which the builder knows that they are new.
struct OwnAddKey : Own {
    static void Build(Table& table, const Texts& keys) {
        table = Korvel::SV_Table;
        for (const std::string& key : keys) table.AddKey(key.c_str()) = 0.5;
    }
};

struct Nlohmann {
    using Table = nlohmann::json;
    static void Build(Table& table, const Numbers& keys) {
        table = Table::array();
        for (int key : keys) table.push_back(key * 0.5);
    }
    static void Build(Table& table, const Texts& keys) {
        table = Table::object();
        for (const std::string& key : keys) table[key] = 0.5;
    }
    static void Copy(Table& copy, const Table& table) { copy = table; }
    static void Destroy(Table& table) { table = nullptr; }
    static double LookUp(const Table& table, int key) {
        return table[static_cast<size_t>(key - 1)].get<double>();
    }
    using Key = std::string;
    static double LookUp(const Table& table, const Key& key) {
        return table.find(key)->get<double>();
    }
    static double LookUp(const Table& table, const char* key) {
        return table.find(key)->get<double>();
    }
};

#ifdef KORVEL_RAPIDJSON
// Its AddMember does not look whether the key is there.
struct Rapid {
    using Table = rapidjson::Document;
    static void Build(Table& table, const Numbers& keys) {
        table.SetArray();
        for (int key : keys) table.PushBack(key * 0.5, table.GetAllocator());
    }
    static void Build(Table& table, const Texts& keys) {
        table.SetObject();
        for (const std::string& key : keys) {
            rapidjson::Value name(key.c_str(), table.GetAllocator());
            table.AddMember(name, 0.5, table.GetAllocator());
        }
    }
    static void Copy(Table& copy, const Table& table) { copy.CopyFrom(table, copy.GetAllocator()); }
    static void Destroy(Table& table) { Table().Swap(table); }
    static double LookUp(const Table& table, int key) {
        return table[static_cast<unsigned>(key - 1)].GetDouble();
    }
    using Key = std::string;
    static double LookUp(const Table& table, const Key& key) {
        return table.FindMember(key.c_str())->value.GetDouble();
    }
    static double LookUp(const Table& table, const char* key) {
        return table.FindMember(key)->value.GetDouble();
    }
};
#endif

struct Map {
    using Table = std::unordered_map<std::string, double>;
    static void Build(Table& table, const Texts& keys) {
        for (const std::string& key : keys) table[key] = 0.5;
    }
    static void Copy(Table& copy, const Table& table) { copy = table; }
    static void Destroy(Table& table) { Table().swap(table); }
    using Key = std::string;
    static double LookUp(const Table& table, const Key& key) { return table.find(key)->second; }
    static double LookUp(const Table& table, const char* key) { return table.find(key)->second; }
};

Numbers MakeKeys(int count, int) {
    Numbers keys;
    for (int i = 1; i <= count; i++) keys.push_back(i);
    return keys;
}

// Names like those of attributes.
Texts MakeKeys(int count, const std::string&) {
    static const char* const names[] = {"Name",   "Volume",   "Pan",   "Position", "IsMuted",
                                        "Colour", "Duration", "Owner", "Channel",  "FadeIn"};
    Texts keys;
    for (int i = 0; i < count; i++) {
        std::string key(names[i % 10]);
        if (i >= 10) key += std::to_string(i / 10);
        keys.push_back(std::move(key));
    }
    return keys;
}

// Runs one phase on as many tables at a time as stay in the cache, so that the clock is read
// rarely. `prepare` and the end of the tables are not timed.
template <class Table>
void Phase(benchmark::State& state, size_t keys, const std::function<void(Table&)>& prepare,
           void (*phase)(Table&, const void*), const void* argument) {
    const size_t count = std::max<size_t>(1, 2000 / keys);
    while (state.KeepRunningBatch(static_cast<benchmark::IterationCount>(count * keys))) {
        std::vector<Table> tables(count);
        if (prepare) std::for_each(tables.begin(), tables.end(), prepare);
        auto started = std::chrono::steady_clock::now();
        for (Table& table : tables) phase(table, argument);
        benchmark::ClobberMemory();
        std::chrono::duration<double> elapsed = std::chrono::steady_clock::now() - started;
        state.SetIterationTime(elapsed.count());
    }
}

// Looks keys up in an order of its own; in large tables a thousand of the keys. `Wanted` is what
// the caller has at hand: a number, a text, or a text that is a key already.
template <class Library, class Wanted, class Keys>
void LookUp(benchmark::State& state, Keys keys) {
    typename Library::Table table;
    Library::Build(table, keys);
    std::shuffle(keys.begin(), keys.end(), std::mt19937(1));
    keys.resize(std::min<size_t>(keys.size(), 1000));
    std::vector<Wanted> wanted;
    for (const auto& key : keys) {
        if constexpr (std::is_same_v<Keys, Texts>) {
            wanted.emplace_back(key.c_str());
        } else {
            wanted.push_back(key);
        }
    }
    size_t next = 0;
    for (auto _ : state) {
        benchmark::DoNotOptimize(Library::LookUp(table, wanted[next]));
        if (++next == wanted.size()) next = 0;
    }
}

template <class Library, class Keys>
void AddPhases(const char* variant, const char* kind, int count) {
    using Table = typename Library::Table;
    const Keys keys = MakeKeys(count, typename Keys::value_type());
    auto add = [&](const char* phase, std::function<void(benchmark::State&)> body) {
        std::string name(phase);
        name.append(" ").append(std::to_string(count)).append(" ").append(kind);
        name.append(" keys@").append(variant);
        return benchmark::RegisterBenchmark(name.c_str(), std::move(body));
    };
    const std::function<void(Table&)> fill = [keys](Table& t) { Library::Build(t, keys); };
    add("build", [=](benchmark::State& state) {
        Phase<Table>(
            state, keys.size(), nullptr,
            [](Table& t, const void* k) { Library::Build(t, *static_cast<const Keys*>(k)); },
            &keys);
    })->UseManualTime();
    add("copy", [=](benchmark::State& state) {
        Table source;
        fill(source);
        Phase<Table>(
            state, keys.size(), nullptr,
            [](Table& t, const void* s) { Library::Copy(t, *static_cast<const Table*>(s)); },
            &source);
    })->UseManualTime();
    add("destroy", [=](benchmark::State& state) {
        Phase<Table>(
            state, keys.size(), fill, [](Table& t, const void*) { Library::Destroy(t); }, nullptr);
    })->UseManualTime();
    if constexpr (std::is_same_v<Keys, Texts>) {
        using Key = typename Library::Key;
        add("look up in", [=](benchmark::State& state) { LookUp<Library, Key>(state, keys); });
        add("look up a C text in",
            [=](benchmark::State& state) { LookUp<Library, const char*>(state, keys); });
    } else {
        add("look up in", [=](benchmark::State& state) { LookUp<Library, int>(state, keys); });
    }
}

}  // namespace

int main(int argc, char** argv) {
    for (int count : {10, 1000, 100'000}) {
        AddPhases<Own, Numbers>("ScriptVal", "number", count);
        AddPhases<Nlohmann, Numbers>("nlohmann", "number", count);
#ifdef KORVEL_RAPIDJSON
        AddPhases<Rapid, Numbers>("RapidJSON", "number", count);
#endif
    }
    for (int count : {10, 30, 100, 300, 1000, 3000}) {
        AddPhases<Own, Texts>("ScriptVal", "text", count);
        AddPhases<OwnAddKey, Texts>("by AddKey", "text", count);
        AddPhases<Nlohmann, Texts>("nlohmann", "text", count);
#ifdef KORVEL_RAPIDJSON
        AddPhases<Rapid, Texts>("RapidJSON", "text", count);
#endif
        AddPhases<Map, Texts>("unordered_map", "text", count);
    }
    return Korvel::Bench::RunComparison(argc, argv);
}
