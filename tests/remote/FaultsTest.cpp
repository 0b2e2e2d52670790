// Peers that break off, stop or fail in the middle, and a system that has run out of something:
// nothing hangs, nothing is left, and whoever waits is released.
#include <gtest/gtest.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <climits>
#include <cstring>
#include <memory>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Platform/Time.h"
#include "RemoteFixture.h"
#include "core/FaultsInternal.h"

namespace Korvel {
namespace {

using namespace Test;

#ifdef __SANITIZE_THREAD__
constexpr int kManyConnections = 1000;
#else
constexpr int kManyConnections = 10000;
#endif

std::string Write(Packet* packet) {
    std::string bytes(reinterpret_cast<const char*>(packet), packet->m_Size);
    FreePkt(packet);
    return bytes;
}

// Held by nobody else.
ScriptVal MakeBox() {
    Box* box = new Box;
    ScriptVal value(box);
    box->DecRef();
    return value;
}

// A call of the application with an object of the peer's among its arguments.
std::string MakeRequest(uint32_t blockSize = 0) {
    std::vector<char> block(blockSize);
    RemoteApp app("writer", 0, nullptr);
    ScriptVal table(SV_Table, nullptr);
    table[1] = MemBlock(block.data(), blockSize);
    ScriptArgs args;
    args.SetArguments(MakeBox(), table);
    Packet* packet = ScriptVal::ToPacket(&app, 1, SST_Call, nullptr, &args);
    packet->m_Context = 1;
    std::string bytes = Write(packet);
    // The object has no number where there is no connection.
    const uint32_t none = UINT_MAX, number = 7;
    size_t place = bytes.find(std::string(reinterpret_cast<const char*>(&none), sizeof none));
    EXPECT_NE(place, std::string::npos);
    memcpy(bytes.data() + place, &number, sizeof number);
    return bytes;
}

std::string WithType(std::string packet, uint32_t type) {
    memcpy(packet.data() + offsetof(Packet, m_Type), &type, sizeof type);
    return packet;
}

// A reply to the first request.
std::string MakeReply(std::string request) {
    const uint32_t zero = 0;
    request = WithType(request, PKT_Reply);
    memcpy(request.data() + offsetof(Packet, m_Symbol), &zero, sizeof zero);
    memcpy(request.data() + offsetof(Packet, m_Target), &zero, sizeof zero);
    return request;
}

class Faulty : public testing::Test {
protected:
    ~Faulty() override {
        EXPECT_TRUE(WaitUntil([this] { return CountDescriptors() == m_NumDescriptors; }));
        EXPECT_EQ(GetNumConnections(), 0u);
    }
    // The connection has ended, and holds nothing of the peer.
    static void ExpectEnd(const Bare& peer) {
        EXPECT_TRUE(WaitUntil([&] {
            return !peer.m_App->Connected() && peer.m_App->GetUseCount() == 1;
        })) << peer.m_App->GetUseCount();
    }

    const int m_NumDescriptors = CountDescriptors();
    BoxHost m_Host;
};

TEST_F(Faulty, PeersThatBreakOffWithinARequest) {
    std::string request = MakeRequest(), large = MakeRequest(100000);
    std::mt19937 random(1);
    for (size_t length = 0; length < request.size(); length++) {
        Bare peer;
        peer.Send(request.data(), static_cast<uint32_t>(length));
        peer.Close(length % 2 != 0);
        ExpectEnd(peer);
    }
    for (int i = 0; i < 10; i++) {
        Bare peer;
        peer.Send(large.data(), static_cast<uint32_t>(random() % large.size()));
        peer.Close();
        ExpectEnd(peer);
    }
    // One that only stops sending gets what it has asked for.
    Bare peer;
    peer.Send(request.data(), static_cast<uint32_t>(request.size()));
    Platform::ShutdownSocket(peer.m_Socket, 2);
    Packet* reply = peer.Receive();
    EXPECT_NE(reply, nullptr);
    FreePkt(reply);
    ExpectEnd(peer);
}

TEST_F(Faulty, PeersThatBreakOffWithinAReply) {
    std::string reply = MakeReply(MakeRequest());
    for (size_t length = 0; length <= reply.size(); length++) {
        Bare peer;
        bool hasReply = false;
        std::thread waiter([&] {
            ScriptVal root = peer.m_App->FindRemoteObject(1);
            ScriptArgs args;
            ScriptVal result;
            hasReply = root.ToRemoteObject()->DoCommand(SST_Call, args, result);
        });
        FreePkt(peer.Receive());
        peer.Send(reply.data(), static_cast<uint32_t>(length));
        peer.Close();  // before it has read the release of the root
        waiter.join();
        EXPECT_EQ(hasReply, length == reply.size()) << length;
        ExpectEnd(peer);
    }
}

// It holds the peer's object, which holds the connection, until the end.
TEST_F(Faulty, PeersThatLeaveStateData) {
    Bare peer;
    std::string packet = WithType(MakeRequest(), PKT_SetStateData);
    peer.Send(packet.data(), static_cast<uint32_t>(packet.size()));
    FreePkt(peer.Receive());
    EXPECT_FALSE(peer.m_App->FindRemoteObject(7).IsNil());
    peer.Close();
    ExpectEnd(peer);
}

// What the peer gives and nobody takes is let go of at once. The peer never tells that it has
// heard.
TEST_F(Faulty, PeersThatDoNotAnswerReleases) {
    constexpr int kNumObjects = 1000, kNumRounds = 100, kFirstRounds = 10;
    Bare writer, peer;  // the first one gives numbers to objects
    ScriptVal table(SV_Table, nullptr);
    for (int i = 1; i <= kNumObjects; i++) table[i] = MakeBox();
    std::string packet = Write(CreatePkt(99, writer.m_App, nullptr, &table));
    size_t before = 0;
    for (int round = 0; round < kNumRounds; round++) {
        if (round == kFirstRounds) before = CountBytes();
        peer.Send(packet.data(), static_cast<uint32_t>(packet.size()));
        int numReleased = 0;
        for (int i = 0; i <= kNumObjects; i++) {
            Packet* next = peer.Receive();
            ASSERT_NE(next, nullptr);
            numReleased += next->m_Type == PKT_NoMoreRefs;
            FreePkt(next);
        }
        ASSERT_EQ(numReleased, kNumObjects);
    }
    EXPECT_LT(CountBytes(), before + (1 << 20));
}

// The second reply may come at the moment when the waiter takes the first.
TEST_F(Faulty, PeersThatAnswerTwice) {
    Bare peer;
    constexpr int kNumCalls = 2000;
    std::thread answers([&] {
        std::string reply = Write(CreatePkt(PKT_Reply, nullptr, nullptr, nullptr));
        for (int i = 0; i < kNumCalls; i++) {
            Packet* request = peer.Receive();
            ASSERT_NE(request, nullptr);
            memcpy(reply.data() + offsetof(Packet, m_Context), &request->m_Context, 4);
            FreePkt(request);
            std::string twice = reply + reply;
            peer.Send(twice.data(), static_cast<uint32_t>(twice.size()));
        }
    });
    int numAnswered = 0;
    for (int i = 0; i < kNumCalls; i++) {
        Packet* reply = peer.m_App->ExchangePkt(CreatePkt(PKT_IncRef, nullptr, nullptr, nullptr));
        if (!reply) break;
        FreePkt(reply);
        numAnswered++;
    }
    answers.join();
    EXPECT_EQ(numAnswered, kNumCalls);
}

TEST_F(Faulty, OneByteAtATime) {
    Bare peer;
    std::string stream = MakeRequest() + MakeRequest(80000) + MakeRequest();
    std::thread writer([&] {
        for (size_t i = 0; i < stream.size(); i++) peer.Send(&stream[i], 1);
    });
    for (int i = 0; i < 3; i++) {
        Packet* reply = peer.Receive();
        EXPECT_TRUE(reply && reply->m_Context == 1);
        FreePkt(reply);
    }
    writer.join();
    EXPECT_TRUE(peer.m_App->Connected());
}

// Many at a time, so that their ends overtake each other.
TEST_F(Faulty, ManyConnectionsOpenedAndDropped) {
    constexpr int kAtOnce = 50;
    std::string request = MakeRequest();
    for (int i = 0; i < kManyConnections / kAtOnce; i++) {
        std::vector<std::unique_ptr<Bare>> peers(kAtOnce);
        for (auto& peer : peers) peer = std::make_unique<Bare>();
        for (size_t k = 0; k < peers.size(); k++) {
            peers[k]->Send(request.data(), static_cast<uint32_t>(k % request.size()));
            peers[k]->Close(true);
        }
    }
}

// The system takes a few MiB for a peer that does not read; the rest waits in the queue. Nobody who
// sends waits, and other connections go on.
TEST_F(Faulty, AReaderThatStops) {
    constexpr uint32_t kBlockSize = 1 << 20;
    std::vector<char> bytes(kBlockSize);
    ScriptVal block = MemBlock(bytes.data(), kBlockSize);
    Bare other;
    auto send = [&](const Bare& peer) {
        Packet* packet = CreatePkt(PKT_SetStateData, peer.m_App, nullptr, &block);
        return peer.m_App->DoPktAsync(packet, nullptr, nullptr) != 0 || (FreePkt(packet), false);
    };
    auto isServed = [](Bare& peer) { return peer.Ask(PKT_GetObjectInfo, 0, 1, 5)[1] == 5; };

    // It takes all of it when it goes on.
    {
        Bare peer;
        constexpr int kNumBlocks = 40;
        for (int i = 0; i < kNumBlocks; i++) EXPECT_TRUE(send(peer));
        EXPECT_TRUE(isServed(other));
        for (int i = 0; i < kNumBlocks; i++) {
            Packet* packet = peer.Receive();
            ASSERT_NE(packet, nullptr);
            EXPECT_GT(packet->m_Size, kBlockSize);
            FreePkt(packet);
        }
        EXPECT_TRUE(isServed(peer));
    }
    {
        Setting limit("KORVEL_MaxQueueSize", "16", "1024");
        Bare peer;
        int numSent = 0;
        while (numSent < 1000 && send(peer)) numSent++;
        EXPECT_GT(numSent, 8);
        EXPECT_LT(numSent, 1000);
        ExpectEnd(peer);
        EXPECT_TRUE(isServed(other));
    }
    {
        Setting limit("KORVEL_StalledQueueSize", "4", "64");
        Setting seconds("KORVEL_StallSeconds", "1", "60");
        Bare peer;
        for (int i = 0; i < 40; i++) EXPECT_TRUE(send(peer));
        ExpectEnd(peer);
        EXPECT_TRUE(isServed(other));
    }
}

// In a process of its own, which is told to do with fewer and fewer.
TEST_F(Faulty, NoDescriptors) {
    fflush(stdout);
    pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        rlimit before = {};
        getrlimit(RLIMIT_NOFILE, &before);
        bool hasFailed = true, isConnected = false;
        for (rlim_t spare = 0; hasFailed; spare++) {
            Ends ends;
            auto* app = new RemoteApp("poor", 0, nullptr);
            int highest = dup(0);
            close(highest);
            rlimit few = before;
            few.rlim_cur = static_cast<rlim_t>(highest) + spare;
            setrlimit(RLIMIT_NOFILE, &few);
            hasFailed = !app->Connect(ends.m_Far);
            // It closes the socket, or works.
            char byte;
            if (hasFailed) {
                EXPECT_EQ(Platform::SocketReceive(ends.m_Near, &byte, 1, nullptr, nullptr), 0);
                EXPECT_FALSE(app->Connected());
            } else {
                std::string request = MakeRequest();
                Platform::SocketSend(ends.m_Near, request.data(), static_cast<int>(request.size()));
                EXPECT_EQ(Platform::SocketReceive(ends.m_Near, &byte, 1, nullptr, nullptr), 1);
                isConnected = true;
            }
            setrlimit(RLIMIT_NOFILE, &before);
            Platform::DeleteSocket(ends.m_Near);
            EXPECT_TRUE(WaitUntil([&] { return !app->Connected(); }));
            app->Recycle();
            EXPECT_TRUE(WaitUntil([&] { return CountDescriptors() == m_NumDescriptors; }));
        }
        fflush(stdout);
        _exit(HasFailure() || !isConnected);
    }
    int status = -1;
    EXPECT_EQ(waitpid(child, &status, 0), child);
    EXPECT_EQ(status, 0);
}

#ifdef KORVEL_FAULTS
// The n-th allocation of either side fails, or all from the n-th on, from connecting to the end of
// two calls, which comes without waiting for their limit.
TEST_F(Faulty, NoMemory) {
    for (bool isInProcess : {false, true}) {
        for (bool forGood : {false, true}) {
            bool isDone = false;
            for (unsigned n = 1; !isDone; n++) {
                ptr<RemoteApp> near(new RemoteApp("near", 0, nullptr));
                ptr<RemoteApp> far(new RemoteApp("far", 0, nullptr));
                near->SetTimeOut(kLimitMs / 1000);
                ScriptVal own = MakeBox(), result;
                std::unique_ptr<Ends> ends(isInProcess ? nullptr : new Ends);
                auto start = std::chrono::steady_clock::now();
                Faults::FailAt(n, forGood);
                bool isConnected = isInProcess ? RemoteApp::Join(near.Get(), far.Get())
                                               : near->Connect(ends->m_Near);
                if (!isInProcess) isConnected = far->Connect(ends->m_Far) && isConnected;
                ScriptVal root = near->FindRemoteObject(1);
                for (int op : {SST_Add, SST_Call}) {
                    ScriptArgs args;
                    if (op == SST_Call) args.SetArguments(own);
                    if (root.IsNil()) continue;
                    root.ToRemoteObject()->DoCommand(op, args, result);
                }
                isDone = Faults::Stop() < n;
                ASSERT_LT(std::chrono::steady_clock::now() - start,
                          std::chrono::milliseconds(kLimitMs))
                    << n;
                EXPECT_TRUE(!isDone || result[-1] == own) << n;
                root = result = SV_Nil;
                for (RemoteApp* app : {near.Get(), far.Get()}) app->_Disconnect(kLimitMs);
                for (RemoteApp* app : {near.Get(), far.Get()}) {
                    EXPECT_TRUE(WaitUntil([&] { return app->GetUseCount() == 1; })) << n;
                }
            }
            EXPECT_TRUE(WaitUntil([] { return Box::s_NumAlive == 1; }));
        }
    }
}
#endif

}  // namespace
}  // namespace Korvel
