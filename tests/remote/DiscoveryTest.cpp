// Asking who is there, and what may answer.
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <cmath>
#include <cstring>
#include <functional>
#include <string>
#include <thread>
#include <vector>

#include "Platform/NetworkingInternal.h"
#include "RemoteFixture.h"
#include "remote/DiscoveryInternal.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptServer.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;

// Plays the script server of this machine: hands each question to `play`, which answers.
class Responder {
public:
    explicit Responder(std::function<void(Responder&)> play) {
        EXPECT_TRUE(Platform::BindSocket(m_Socket, 0, kLoopback));
        Platform::_SocketAddress* address = Platform::GetSocketAddress(m_Socket);
        g_ScriptServerPort = Platform::SocketAddressGetPort(address);
        Platform::DeleteSocketAddress(address);
        m_Thread = std::thread([this, play] {
            for (;;) {
                char bytes[2048];
                unsigned int ip, length = Platform::SocketReceive(m_Socket, bytes, sizeof bytes,
                                                                  &m_AskerPort, &ip);
                m_Question.assign(bytes, length);
                if (m_IsOver) return;
                play(*this);
            }
        });
    }
    Responder(const Responder&) = delete;
    Responder& operator=(const Responder&) = delete;
    ~Responder() {
        m_IsOver = true;
        Platform::_Socket* socket = Platform::NewSocket(Platform::ST_UDP);
        Platform::_SocketAddress* own = Platform::NewSocketAddress(g_ScriptServerPort, kLoopback);
        Platform::SocketSendTo(socket, "end", 3, own);
        Platform::DeleteSocketAddress(own);
        Platform::DeleteSocket(socket);
        m_Thread.join();
        Platform::DeleteSocket(m_Socket);
        g_ScriptServerPort = m_OldPort;
    }

    void Answer(const std::string& bytes) const {
        Platform::_SocketAddress* to = Platform::NewSocketAddress(m_AskerPort, kLoopback);
        Platform::SocketSendTo(m_Socket, bytes.data(), static_cast<int>(bytes.size()), to);
        Platform::DeleteSocketAddress(to);
    }

    std::string m_Question;  // for `play`
    std::atomic<bool> m_IsOver{false};

private:
    const unsigned int m_OldPort = g_ScriptServerPort;
    Platform::_Socket* const m_Socket = Platform::NewSocket(Platform::ST_UDP);
    unsigned int m_AskerPort = 0;
    std::thread m_Thread;
};

// The text of an answer that fills a datagram, its NUL included if it is given one.
std::string Full(size_t size) {
    std::string text = "RSP:{HostName=\"h\",x=\"";
    return text + std::string(size - text.size() - 2, 'x') + "\"}";
}

TEST(Discovery, KeepsWhatIsAnAnswer) {
    struct Case {
        std::string bytes;
        bool isKept;
        int numKeys;  // beside what Ping adds
    };
    using std::string_literals::operator""s;
    const Case cases[] = {
        {"RSP:{HostName=\"far\",Version=\"18.0\",Hosts={\"a\",\"b\"}}\0"s, true, 2},
        {"RSP:{HostName=\"far\",IP=\"1.2.3.4\"}\0"s, true, 0},
        {"RSP:{HostName=\"far\"}", true, 0},  // no NUL
        {Full(kMaxDatagram), true, 1},
        {Full(kMaxDatagram + 1), true, 0},  // its end is lost
        {"RSP:", true, 0},
        {"RSP:\0"s, true, 0},
        {"RSP:5\0"s, true, 0},
        {"RSP:{HostName=", true, 0},
        {"RSP:{" + std::string(1000, '{'), true, 0},
        {"RSP:{x=(function() while true do end end)()}\0"s, true, 0},
        {"RSP", false, 0},
        {"", false, 0},
        {"SPP:{}\0"s, false, 0},
        {"rsp:{}\0"s, false, 0},
        {std::string(1024, '\xff'), false, 0}};
    std::string question;
    Responder responder([&](Responder& self) {
        question = self.m_Question;
        for (const Case& c : cases) self.Answer(c.bytes);
        self.Answer("RSP:{HostName=\"last\"}\0"s);
    });
    ScriptVal result(5);
    // The last one may take as long as the texts before it may.
    EXPECT_TRUE(WaitUntil([&] {
        EXPECT_TRUE(Ping("Some Host", 1, result, kLoopback));
        return result.FindKeyConst(result.NumKeys()).FindKeyConst("HostName") == "last";
    }));
    EXPECT_EQ(question, "SPP:Some Host");
    int index = 1;
    for (const Case& c : cases) {
        if (!c.isKept) continue;
        SCOPED_TRACE(c.bytes.substr(0, 40));
        const ScriptVal& answer = result.FindKeyConst(index++);
        ASSERT_TRUE(answer.IsTable());
        EXPECT_TRUE(answer.FindKeyConst("IP") == "127.0.0.1");
        int hasName = !answer.FindKeyConst("HostName").IsNil();
        EXPECT_EQ(static_cast<int>(answer.NumKeys()) - 1 - hasName, c.numKeys);
    }
    EXPECT_TRUE(result[1]["Hosts"][2] == "b");
    EXPECT_EQ(static_cast<int>(result.NumKeys()), index) << "and the last one";
}

TEST(Discovery, EndsInTime) {
    auto expectTime = [](double timeOut, double leastSeconds, unsigned int numAnswers) {
        ScriptVal result;
        auto start = std::chrono::steady_clock::now();
        EXPECT_TRUE(Ping(nullptr, timeOut, result, kLoopback));
        std::chrono::duration<double> taken = std::chrono::steady_clock::now() - start;
        EXPECT_GE(taken.count(), leastSeconds);
        EXPECT_LT(taken.count(), kLimitMs / 1000 / 2.);
        EXPECT_EQ(result.NumKeys(), numAnswers);
    };
    {
        Responder silent([](Responder& self) { EXPECT_EQ(self.m_Question, "SPP:"); });
        expectTime(0.05, 0.05, 0);
        for (double none : {0., -1., static_cast<double>(NAN)}) expectTime(none, 0, 0);
    }
    {
        Responder garbage([](Responder& self) {
            while (!self.m_IsOver) self.Answer("no answer");
        });
        expectTime(0.1, 0.1, 0);
    }
    Responder flood([](Responder& self) {
        while (!self.m_IsOver) self.Answer("RSP:");
    });
    expectTime(kLimitMs, 0, 4096);
}

TEST(Discovery, TellsWhenItCannotAsk) {
    Responder responder([](Responder&) {});
    ScriptVal result;
    EXPECT_TRUE(Ping(std::string(kMaxDatagram - kMagicSize, 'n').c_str(), 0, result, kLoopback));
    EXPECT_FALSE(
        Ping(std::string(kMaxDatagram - kMagicSize + 1, 'n').c_str(), 0, result, kLoopback));
    unsigned int port = std::exchange(g_ScriptServerPort, 70000);
    EXPECT_FALSE(Ping("", 0, result, kLoopback));
    EXPECT_TRUE(result.IsTable() && result.NumKeys() == 0);
    g_ScriptServerPort = port;
}

}  // namespace
}  // namespace Korvel
