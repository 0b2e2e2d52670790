// What a host notices of its connections, and how they end by themselves.
#include <gtest/gtest.h>
#include <linux/filter.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <condition_variable>
#include <deque>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "Platform/Events.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/Threads.h"
#include "RemoteFixture.h"
#include "remote/ConnectApp.h"

namespace Korvel {
namespace {

using namespace Korvel::Test;

// A host whose UI thread is the test's. It runs its jobs when the test says so.
class HostTest : public testing::Test {
protected:
    HostTest() {
        s_This = this;
        m_Host.m_Config.m_Active = true;
        m_Host.m_Config.UIExecute = Execute;
        m_Host.m_Config.OnConnect = [](void*, RemoteApp*, TagList*) { s_This->m_Told += "C"; };
        m_Host.m_Config.OnDisconnect = [](void*, RemoteApp*, TagList*) { s_This->m_Told += "D"; };
        SetGUIThread(Platform::GetCurrentThreadID());
        g_NoGUI = false;
    }
    ~HostTest() override {
        RunUI([this] {
            return GetNumConnections() == 0 && Box::s_NumAlive == 1 &&
                   m_Host.m_Root->GetCount() == 1;
        });
        g_NoGUI = true;
    }

    struct Job {
        ScriptConfig::UIFunction m_Function;
        void* m_A;
        void* m_B;
        KorvelScript::Event* m_Done;
    };

    static unsigned long long Execute(ScriptConfig::UIFunction function, void* a, void* b,
                                      bool wait) {
        KorvelScript::Event done;
        {
            std::lock_guard guard(s_This->m_Mutex);
            s_This->m_Jobs.push_back({function, a, b, wait ? &done : nullptr});
            s_This->m_HasJobs.notify_all();  // whoever runs the job may end all of this
        }
        if (wait) done.Wait(kLimitMs);
        return 0;
    }

    // The peer calls a member that has to run on the UI thread; its connection waits for that.
    void CallUI(const Bare& peer) {
        ScriptArgs args;
        peer.Send(ScriptVal::ToPacket(nullptr, 1, SST_CallFunction, nullptr, &args));
        WaitForJob();
    }

    void WaitForJob() {
        std::unique_lock lock(m_Mutex);
        m_HasJobs.wait(lock, [this] { return !m_Jobs.empty(); });
    }

    // Runs jobs until something is so.
    void RunUI(const std::function<bool()>& isSo) {
        EXPECT_TRUE(WaitUntil([&] {
            for (;;) {
                Job job;
                {
                    std::lock_guard guard(m_Mutex);
                    if (m_Jobs.empty()) return isSo();
                    job = m_Jobs.front();
                    m_Jobs.pop_front();
                }
                job.m_Function(job.m_A, job.m_B);
                if (job.m_Done) job.m_Done->Signal();
            }
        }));
    }

    static inline HostTest* s_This;
    BoxHost m_Host;
    std::mutex m_Mutex;
    std::condition_variable m_HasJobs;
    std::deque<Job> m_Jobs;
    std::string m_Told;
};

// All on the UI thread: the news, and the end of what the peer has held.
TEST_F(HostTest, IsToldOfConnections) {
    Ends ends;
    auto* app = new RemoteApp("near", 0, ends.m_Near);
    auto* peer = new RemoteApp("far", 0, nullptr);
    ASSERT_TRUE(peer->Connect(ends.m_Far));  // of which the host is not told
    RunUI([this] { return m_Told == "C"; });
    auto* box = new Box;
    ScriptVal seen(box);  // by scripts
    RemoteObject* proxy = peer->LocalToRemote(reinterpret_cast<uintptr_t>(box));
    ASSERT_NE(proxy, nullptr);
    seen = SV_Nil;
    box->DecRef();
    peer->_Disconnect(0);
    WaitUntil([&] { return !app->Connected(); });
    WaitForJob();
    EXPECT_EQ(Box::s_NumAlive, 2) << "until the UI thread takes it back";
    RunUI([this] { return m_Told == "CD" && Box::s_NumAlive == 1; });
    app->Recycle();
    proxy->DecRef();
    peer->Recycle();
}

// A wait of the UI thread for a peer whose call waits for the UI thread would have no end.
TEST_F(HostTest, DoesNotWaitForWhatWaitsForIt) {
    Bare peer;
    auto ask = [&] { return peer.m_App->ExchangePkt(CreatePkt(PKT_Script, nullptr, 0, 0)); };
    auto expectReply = [&] {
        RunUI([] { return true; });
        Packet* reply = peer.Receive();
        ASSERT_NE(reply, nullptr);
        EXPECT_EQ(reply->m_Type, PKT_Reply);
        FreePkt(reply);
    };

    CallUI(peer);
    EXPECT_EQ(ask(), nullptr) << "the call came before the wait";
    expectReply();

    SetGUIThread(0);
    std::thread ui([&] {
        SetGUIThread(Platform::GetCurrentThreadID());
        EXPECT_EQ(ask(), nullptr) << "the call comes during the wait";
    });
    FreePkt(peer.Receive());
    CallUI(peer);
    ui.join();
    expectReply();
    SetGUIThread(Platform::GetCurrentThreadID());
}

// Nor has a wait for the end of such a connection.
TEST_F(HostTest, DoesNotWaitForTheEndOfWhatWaitsForIt) {
    Bare first;
    CallUI(first);
    EXPECT_FALSE(first.m_App->_Disconnect(Platform::kNoTimeLimit)) << "the call came before";
    RunUI([] { return true; });

    Bare second;
    ScriptVal query("wait");
    Packet* packet = CreatePkt(PKT_GetObjectInfo, nullptr, nullptr, &query);
    packet->m_Target = 1;
    second.Send(packet);
    ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));
    SetGUIThread(0);
    std::atomic<pid_t> thread{0};
    std::thread ui([&] {
        SetGUIThread(Platform::GetCurrentThreadID());
        thread = gettid();
        EXPECT_FALSE(second.m_App->_Disconnect(Platform::kNoTimeLimit)) << "the call comes later";
    });
    EXPECT_TRUE(WaitUntil([&] { return thread && IsAsleep(thread); }));
    ScriptArgs args;  // of a call that is served although the connection is to end
    second.Send(ScriptVal::ToPacket(nullptr, 1, SST_CallFunction, nullptr, &args));
    Box::s_Gate.Signal();
    WaitForJob();
    ui.join();
    SetGUIThread(Platform::GetCurrentThreadID());
    RunUI([] { return true; });
}

TEST_F(HostTest, IsToldOfBothEndsOrNeither) {
    for (int i = 0; i < 50; i++) {
        Ends ends;
        Platform::DeleteSocket(ends.m_Far);
        auto* app = new RemoteApp("brief", 0, ends.m_Near);
        bool isOver = i % 2 == 0;
        EXPECT_TRUE(!isOver || WaitUntil([&] { return !app->Connected(); }));
        RunUI([&] { return !app->Connected() && app->GetUseCount() == 1; });
        EXPECT_TRUE(m_Told.empty() || (m_Told == "CD" && !isOver)) << m_Told;
        m_Told.clear();
        app->Recycle();
    }
}

// A call that waits for the UI thread, and a reply that comes later, go with their run.
TEST_F(HostTest, TellsTheNextPeerNothingOfTheLastOne) {
    Bare peer;
    auto call = [&] {
        ScriptArgs args;
        Packet* packet = ScriptVal::ToPacket(nullptr, 1, SST_Concat, nullptr, &args);
        packet->m_Context = 77;
        peer.Send(packet);
        WaitForJob();
    };
    call();
    RunUI([] { return true; });
    ASSERT_TRUE(Box::s_Entered.Wait(kLimitMs));
    std::unique_ptr<ScriptArgs> deferred(Box::s_Deferred);
    call();
    peer.Reconnect();
    RunUI([] { return true; });
    EXPECT_FALSE(Box::s_Entered.Wait(0));
    deferred->ReturnString("late");
    EXPECT_FALSE(deferred->SendReply());
    EXPECT_TRUE(peer.Ask(PKT_GetObjectInfo, 0, 1, 5)[1] == 5);  // whose reply is the first
}

// What one peer may leave to the UI thread has a limit. Counts go past it.
TEST_F(HostTest, LimitsWhatWaitsForTheUIThread) {
    constexpr uint32_t kMost = 65536;
    Bare peer;
    ScriptArgs args;
    args.SetArguments(1);
    for (uint32_t i = 1; i <= kMost; i++) {
        Packet* packet = ScriptVal::ToPacket(peer.m_App, 1, SST_Call, nullptr, &args);
        packet->m_Context = i;
        peer.Send(packet);
    }
    EXPECT_TRUE(peer.Ask(PKT_IncRef, 0, 1).IsNil());
    ScriptVal refused = peer.Ask(PKT_Script, SST_Call, 1, args);
    EXPECT_TRUE(refused["ErrorString"] == "Too many unanswered requests.");
    RunUI([] { return true; });
    for (uint32_t i = 1; i <= kMost; i++) {
        Packet* reply = peer.Receive();
        ASSERT_TRUE(reply && reply->m_Context == i);
        FreePkt(reply);
    }
}

// The peer may let go of what it has called before the UI thread comes to the call.
TEST_F(HostTest, FindsWhatWasCalled) {
    Bare peer;
    ScriptArgs args;
    args.SetArguments(5);
    for (uint32_t type : {PKT_Script, PKT_NoMoreRefs, PKT_SetStateData}) {
        Packet* packet = CreatePkt(type, nullptr, nullptr, &args);
        packet->m_Symbol = SST_Call;
        packet->m_Target = 1;
        packet->m_Context = type;
        peer.Send(packet);
    }
    ScriptVal result;
    for (int i = 0; i < 3; i++) {
        Packet* reply = peer.Receive();
        ASSERT_NE(reply, nullptr);
        if (reply->m_Context == PKT_Script) {
            EXPECT_TRUE(ScriptVal::FromPacket(peer.m_App, reply, nullptr, &result));
        } else if (reply->m_Context == PKT_SetStateData) {
            RunUI([] { return true; });  // all three have come
        }
        FreePkt(reply);
    }
    EXPECT_TRUE(result[-1] == 5) << result["ErrorString"].ToString("none");
}

// A connection that nobody owns ends when neither side has anything of the other.
TEST_F(HostTest, NeedsNoOwnerForWhoIsServed) {
    Ends ends;
    auto* served = new ConnectApp("served", 0);
    auto* app = new RemoteApp("asks", 0, nullptr);
    app->Use();
    ScriptVal root = app->FindRemoteObject(1);
    ASSERT_TRUE(app->Connect(ends.m_Near) && served->Connect(ends.m_Far));
    served->SetRoot(served->FindRemoteObject(1));
    served->Recycle();
    RunUI([&] { return !m_Jobs.empty() || app->GetUseCount() > 3; });
    EXPECT_TRUE(app->Connected());
    root = SV_Nil;
    RunUI([&] { return !app->Connected(); });
    app->Recycle();
    RunUI([&] { return app->GetUseCount() == 1; });
    app->Recycle();
}

TEST_F(HostTest, SendsWhatIsQueuedBeforeTheEnd) {
    Bare peer;
    std::string bytes(4 << 20, 'x');
    peer.m_App->SetStateData(ScriptVal(bytes.c_str()));
    peer.m_App->_Disconnect(0);
    Packet* packet = peer.Receive();
    ASSERT_TRUE(packet && packet->m_Type == PKT_SetStateData);
    FreePkt(packet);
    EXPECT_EQ(peer.Receive(), nullptr);
}

// What the peer's machine does when it is cut off: it takes nothing and answers nothing.
void MakeDeaf(Platform::_Socket* socket) {
    sock_filter drop = BPF_STMT(BPF_RET | BPF_K, 0);
    sock_fprog program = {1, &drop};
    EXPECT_EQ(setsockopt(Platform::SocketDescriptor(socket), SOL_SOCKET, SO_ATTACH_FILTER, &program,
                         sizeof program),
              0);
}

TEST_F(HostTest, NoticesThatAPeerHasVanished) {
    Setting timeout("KORVEL_PeerTimeoutSeconds", "3", "90");
    Bare silent, waitedFor, busy;
    MakeDeaf(silent.m_Socket);
    MakeDeaf(waitedFor.m_Socket);
    std::thread waiter([&] {
        EXPECT_EQ(waitedFor.m_App->ExchangePkt(CreatePkt(PKT_Script, nullptr, 0, 0)), nullptr);
    });
    std::string bytes(16 << 20, 'x');
    busy.m_App->SetStateData(ScriptVal(bytes.c_str()));
    waiter.join();
    EXPECT_TRUE(
        WaitUntil([&] { return !silent.m_App->Connected() && !waitedFor.m_App->Connected(); }));
    EXPECT_TRUE(busy.m_App->Connected()) << "a peer that does not read is none that has vanished";
}

}  // namespace
}  // namespace Korvel
