// Callers of a script server that mean no good, or that die at a bad moment, while one that behaves
// gets all its answers.
#include <gtest/gtest.h>
#include <sys/resource.h>

#include <atomic>
#include <filesystem>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "ServerFixture.h"
#include "remote/Packets.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;
using Platform::_Socket;

// The bytes of a call of the server by the name of a member.
std::string CallOf(uint32_t context, const char* member, const ScriptVal& value) {
    ScriptArgs args;
    args.SetArguments(value);
    args.SetPosition(0, member);
    Packet* packet = ScriptVal::ToPacket(nullptr, 1, SST_CallMemberFunction, nullptr, &args);
    packet->m_Context = context;
    std::string bytes(reinterpret_cast<char*>(packet), packet->m_Size);
    FreePkt(packet);
    return bytes;
}

class HostileCallersTest : public testing::Test {
protected:
    HostileCallersTest() {
        s_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return nullptr; };
        g_ScriptConfig = &s_Config;
        EXPECT_TRUE(m_Server.AwaitLine("Started"));
        ScriptVal good = m_Server.Connect();
        EXPECT_TRUE(good.CallMember("AddHost", Table({{"Name", "Good"}})) == true);
        m_Thread = std::thread([this, good]() mutable {
            while (!m_MustEnd) {
                EXPECT_TRUE(good.CallMember("FindHost", "Good")["Name"] == "Good");
                m_NumAnswers++;
            }
        });
    }
    // Whatever the others have done, they are forgotten, and it ends as it should.
    ~HostileCallersTest() override {
        AwaitAnswers();
        EXPECT_TRUE(
            WaitUntil([&] { return m_Server.Connect().CallMember("GetHostList").NumKeys() == 1; }));
        m_MustEnd = true;
        m_Thread.join();
        EXPECT_TRUE(m_Server.AwaitLine("Terminated\n"));
        EXPECT_EQ(m_Server.AwaitEnd(), 0);
        EXPECT_TRUE(WaitUntil([] { return GetNumConnections() == 0; }));
        g_ScriptConfig = nullptr;
    }

    void AwaitAnswers() {
        int before = m_NumAnswers;
        EXPECT_TRUE(WaitUntil([&] { return m_NumAnswers > before + 2; }));
    }

    static void End(_Socket* socket, bool abruptly) {
        if (abruptly) Platform::SetSocketLinger(socket, true, 0);
        Platform::DeleteSocket(socket);
    }

    void CallAndEnd(const std::string& bytes, bool abruptly) const {
        _Socket* socket = m_Server.Call();
        Platform::SocketSend(socket, bytes.data(), static_cast<int>(bytes.size()));
        End(socket, abruptly);
    }

    unsigned CountServerDescriptors() const {
        namespace fs = std::filesystem;
        std::string folder = "/proc/" + std::to_string(m_Server.GetProcess()) + "/fd";
        return static_cast<unsigned>(std::distance(fs::directory_iterator(folder), {}));
    }

    static inline ScriptConfig s_Config;  // the last connection may be about to end
    ServerProcess m_Server;
    std::atomic<bool> m_MustEnd{false};
    std::atomic<int> m_NumAnswers{0};
    std::thread m_Thread;
};

TEST_F(HostileCallersTest, DieAtEachByte) {
    const std::string whole = CallOf(1, "AddHost", Table({{"Name", "Brief"}})) +
                              CallOf(2, "NotifyHosts", "Nothing") + CallOf(3, "GetHostList", {});
    for (size_t length = 0; length <= whole.size(); length++) {
        CallAndEnd(whole.substr(0, length), length % 2);
    }
}

TEST_F(HostileCallersTest, ChangeBytes) {
    const std::string whole = CallOf(1, "AddHost", Table({{"Name", "Odd"}, {"Port", 5}}));
    std::mt19937 random(8);
    for (size_t at = 0; at < whole.size(); at++) {
        std::string changed = whole;
        changed[at] = static_cast<char>(random());
        CallAndEnd(changed + whole, at % 2);
    }
}

TEST_F(HostileCallersTest, AnnounceWhatNeverComes) {
    std::vector<_Socket*> sockets;
    for (uint32_t size : {0u, 39u, 40u, 100000000u, 256u << 20, (256u << 20) + 1, 0xFFFFFFFFu}) {
        std::string bytes = CallOf(1, "AddHost", Table({{"Name", "Large"}}));
        memcpy(bytes.data(), &size, sizeof size);
        sockets.push_back(m_Server.Call());
        Platform::SocketSend(sockets.back(), bytes.data(), static_cast<int>(bytes.size()));
        AwaitAnswers();
    }
    for (_Socket* socket : sockets) End(socket, false);
}

TEST_F(HostileCallersTest, AreFiveHundredAtOnce) {
    std::vector<_Socket*> sockets;
    std::string call = CallOf(1, "AddHost", Table({{"Name", "Crowd"}}));
    for (int i = 0; i < 500; i++) {
        sockets.push_back(m_Server.Call());
        if (i % 2) Platform::SocketSend(sockets.back(), call.data(), static_cast<int>(call.size()));
    }
    AwaitAnswers();
    EXPECT_TRUE(m_Server.Connect().CallMember("FindHost", "Good").IsTable());
    for (_Socket* socket : sockets) End(socket, true);
}

// Those who call are turned away, and served when there is room once more.
TEST_F(HostileCallersTest, TakeAllDescriptors) {
    rlimit old;
    ASSERT_EQ(prlimit(m_Server.GetProcess(), RLIMIT_NOFILE, nullptr, &old), 0);
    rlimit limit = {CountServerDescriptors() + 12, old.rlim_max};
    ASSERT_EQ(prlimit(m_Server.GetProcess(), RLIMIT_NOFILE, &limit, nullptr), 0);
    std::vector<_Socket*> sockets;
    for (int i = 0; i < 64; i++) sockets.push_back(m_Server.Call());
    // The last one is told, rather than left to wait.
    char byte;
    EXPECT_EQ(Platform::SocketReceive(sockets.back(), &byte, 1, nullptr, nullptr), 0u);
    AwaitAnswers();
    for (_Socket* socket : sockets) End(socket, false);
    EXPECT_TRUE(
        WaitUntil([&] { return m_Server.Connect().CallMember("FindHost", "Good").IsTable(); }));
}

}  // namespace
}  // namespace Korvel
