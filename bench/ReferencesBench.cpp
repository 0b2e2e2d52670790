// What it takes to pass an object to a peer that already knows others: the count of the exporter,
// its look-up for a call, and the count of the peer's proxy, there and back; then the same within
// packets. With many objects and with few, and beside hash maps under a mutex that only count.
#include <cstdint>
#include <cstdlib>
#include <memory>
#include <mutex>
#include <unordered_map>
#include <vector>

#include "Compare.h"
#include "core/RefObject.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

namespace {

using namespace Korvel;

// A connection that only counts: nothing is sent.
class OpenApp : public RemoteApp {
public:
    OpenApp() : RemoteApp("bench", 0, nullptr) {}
    ~OpenApp() override = default;
    bool Connected() const override { return m_IsOpen; }
    uint32_t DoPktAsync(Packet* packet, AsyncCallback, void*) override {
        FreePkt(packet);
        return 1;
    }
    void Disconnect() override {}
    void End() {
        m_IsOpen = false;
        Cleanup(GetRun());
    }

private:
    bool m_IsOpen = true;
};

class Connection {
public:
    explicit Connection(size_t count) : m_IDs(count) {
        for (size_t i = 0; i < count; i++) {
            m_Objects.push_back(std::make_unique<_Object>());
            m_IDs[i] = m_Exporter._IncLocalRef(m_Objects[i].get())->m_ID;
            m_Reader.IncRemoteRef(m_IDs[i]);
        }
    }
    ~Connection() {
        for (uint32_t id : m_IDs) m_Reader.DecRemoteRef(id);
        m_Exporter.End();
    }
    void Pass(size_t i) {
        RemoteObject* record = m_Exporter._IncLocalRef(m_Objects[i].get());
        RemoteObject* proxy = m_Reader.IncRemoteRef(record->m_ID);
        benchmark::DoNotOptimize(m_Exporter.FindLocalObject(proxy->m_ID));
        proxy->DecRef();
        record->DecRef();
    }

protected:
    std::vector<std::unique_ptr<_Object>> m_Objects;
    std::vector<uint32_t> m_IDs;
    OpenApp m_Exporter, m_Reader;
};

class Packets : public Connection {
public:
    using Connection::Connection;
    void Pass(size_t i) {
        ScriptVal value(m_Objects[i].get());
        Carry(m_Exporter, m_Reader, value);
        Carry(m_Reader, m_Exporter, value);
        if (value.ToLocalObject() != m_Objects[i].get()) abort();
    }

private:
    static void Carry(RemoteApp& from, RemoteApp& to, ScriptVal& value) {
        Packet* packet = CreatePkt(PKT_Script, &from, nullptr, &value);
        ScriptVal::FromPacket(&to, packet, nullptr, &value);
        FreePkt(packet);
    }
};

class Maps {
public:
    explicit Maps(size_t count) : m_Objects(count) {
        for (size_t i = 0; i < count; i++) {
            m_ByObject[&m_Objects[i]] = static_cast<uint32_t>(i);
            m_Counts[static_cast<uint32_t>(i)] = m_Proxies[static_cast<uint32_t>(i)] = 1;
        }
    }
    void Pass(size_t i) {
        uint32_t id;
        {
            std::lock_guard guard(m_Lock);
            id = m_ByObject.find(&m_Objects[i])->second;
            m_Counts.find(id)->second++;
        }
        Add(m_Proxies, id, 1);
        Add(m_Counts, id, 0);
        Add(m_Proxies, id, -1);
        Add(m_Counts, id, -1);
    }

private:
    void Add(std::unordered_map<uint32_t, int>& counts, uint32_t id, int change) {
        std::lock_guard guard(m_Lock);
        benchmark::DoNotOptimize(counts.find(id)->second += change);
    }

    std::mutex m_Lock;
    std::vector<char> m_Objects;
    std::unordered_map<const char*, uint32_t> m_ByObject;
    std::unordered_map<uint32_t, int> m_Counts, m_Proxies;
};

constexpr size_t kMany = 100000;
constexpr size_t kFew = 10;

// In an order that the processor does not foresee; the counts have no factor in common with it.
constexpr size_t kStep = 61803;

// Step 0 passes one object again and again.
template <class Tables, size_t count, size_t step>
void Pass(benchmark::State& state) {
    Tables tables(count);
    size_t i = count / 2;
    for (auto _ : state) {
        tables.Pass(i);
        i = (i + step) % count;
    }
}

BENCHMARK_TEMPLATE(Pass, Connection, kMany, 0)->Name("one of them@100000 exported");
BENCHMARK_TEMPLATE(Pass, Connection, kFew, 0)->Name("one of them@10 exported");
BENCHMARK_TEMPLATE(Pass, Maps, kMany, 0)->Name("one of them@maps of 100000");
BENCHMARK_TEMPLATE(Pass, Connection, kMany, kStep)->Name("all in turn@100000 exported");
BENCHMARK_TEMPLATE(Pass, Connection, kFew, kStep)->Name("all in turn@10 exported");
BENCHMARK_TEMPLATE(Pass, Maps, kMany, kStep)->Name("all in turn@maps of 100000");
BENCHMARK_TEMPLATE(Pass, Packets, kMany, 0)->Name("one of them, in packets@100000 exported");
BENCHMARK_TEMPLATE(Pass, Packets, kFew, 0)->Name("one of them, in packets@10 exported");
BENCHMARK_TEMPLATE(Pass, Packets, kMany, kStep)->Name("all in turn, in packets@100000 exported");
BENCHMARK_TEMPLATE(Pass, Packets, kFew, kStep)->Name("all in turn, in packets@10 exported");

}  // namespace

int main(int argc, char** argv) {
    return Korvel::Bench::RunComparison(argc, argv);
}
