#include "Platform/Networking.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/time.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstring>
#include <thread>
#include <vector>

#include "Platform/NetworkingInternal.h"
#include "Platform/Time.h"

namespace Korvel::Platform {
namespace {

constexpr unsigned kLong = 20000;  // only ever reached by a failure
constexpr unsigned kReadable = SE_READ | SE_ACCEPT, kWritable = SE_WRITE | SE_CONNECT;
const unsigned kLoopback = htonl(INADDR_LOOPBACK);
_Socket* const kNoSocket = reinterpret_cast<_Socket*>(-1);

// A socket that goes with its scope; bound to loopback if it is made here.
struct Owned {
    explicit Owned(_Socket* socket) : m_Socket(socket) {}
    explicit Owned(SocketType type) : Owned(NewSocket(type)) {
        EXPECT_TRUE(BindSocket(*this, 0, kLoopback));
        m_Address = GetSocketAddress(*this);
        EXPECT_EQ(SocketAddressGetIP(m_Address), kLoopback);
    }
    Owned(const Owned&) = delete;
    ~Owned() {
        Delete();
        EXPECT_EQ(DeleteSocketAddress(m_Address), m_Address != nullptr);
    }
    operator _Socket*() const { return m_Socket; }
    int Fd() const { return SocketDescriptor(m_Socket); }
    unsigned Port() const { return SocketAddressGetPort(m_Address); }
    void Delete() {
        EXPECT_TRUE(m_Socket == kNoSocket || DeleteSocket(m_Socket));
        m_Socket = kNoSocket;
    }
    _Socket* m_Socket;
    _SocketAddress* m_Address = nullptr;
};

struct Listener : Owned {
    explicit Listener(int backlog) : Owned(ST_TCP) { EXPECT_TRUE(ListenSocket(*this, backlog)); }
    bool Call(_Socket* from) const { return ConnectSocket(from, Port(), kLoopback); }
};

// A connection over loopback.
struct Pair {
    Pair()
        : m_Listener(0),
          m_Near(ST_TCP),
          m_Far((m_Listener.Call(m_Near), AcceptSocket(m_Listener))) {}
    Listener m_Listener;
    Owned m_Near, m_Far;
};

struct Set {
    explicit Set(int maxSockets) : m_Set(NewSocketSet(maxSockets)) {}
    ~Set() { EXPECT_TRUE(DeleteSocketSet(m_Set)); }
    operator _SocketSet*() const { return m_Set; }
    _SocketSet* m_Set;
};

TEST(Sockets, StreamThereAndBack) {
    Pair pair;
    for (const Owned* socket : {&pair.m_Near, &pair.m_Far, &static_cast<Owned&>(pair.m_Listener)}) {
        EXPECT_EQ(fcntl(socket->Fd(), F_GETFD), FD_CLOEXEC);
    }
    unsigned port = 0;
    EXPECT_EQ(GetSocketPeerIP(pair.m_Near, &port), kLoopback);
    EXPECT_EQ(port, htons(static_cast<uint16_t>(pair.m_Listener.Port())));
    EXPECT_TRUE(SetSocketNoDelay(pair.m_Near, true) && SetSocketLinger(pair.m_Near, false, 10));

    char data[8] = {};
    EXPECT_EQ(SocketSend(pair.m_Near, "hello", 5), 5u);
    EXPECT_EQ(SocketReceive(pair.m_Far, data, 2, &port, nullptr), 2u);
    EXPECT_EQ(SocketReceive(pair.m_Far, data + 2, 6, nullptr, nullptr), 3u);
    EXPECT_STREQ(data, "hello");
    EXPECT_EQ(port, htons(static_cast<uint16_t>(pair.m_Listener.Port())));  // one alone is not used

    // Would-block and an orderly close are both 0 bytes; the error tells them apart.
    EXPECT_TRUE(SetSocketNonBlocking(pair.m_Far, true));
    EXPECT_EQ(SocketReceive(pair.m_Far, data, 8, nullptr, nullptr), 0u);
    EXPECT_EQ(GetSocketError(), SERR_WOULDBLOCK);
    EXPECT_FALSE(ShutdownSocket(pair.m_Near, 0) || ShutdownSocket(pair.m_Near, 4));
    EXPECT_TRUE(ShutdownSocket(pair.m_Near, 2) && SetSocketNonBlocking(pair.m_Far, false));
    errno = EAGAIN;
    EXPECT_EQ(SocketReceive(pair.m_Far, data, 8, nullptr, nullptr), 0u);
    EXPECT_EQ(GetSocketError(), SERR_NONE);

    pair.m_Near.Delete();  // writing to a peer that is gone fails in the end, and raises no signal
    for (int i = 0; i < 1000 && SocketSend(pair.m_Far, "x", 1); i++) Wait(1);
    EXPECT_EQ(SocketSend(pair.m_Far, "x", 1), 0u);
    EXPECT_EQ(GetSocketError(), SERR_FAILED);
}

TEST(Sockets, DatagramsTellTheirSender) {
    Owned one(ST_UDP), other(ST_UDP);
    char data[4] = {};
    unsigned port = 1, ip = 1;
    EXPECT_TRUE(SetSocketBroadcast(one, true) && SetSocketNonBlocking(one, true));
    EXPECT_EQ(SocketReceive(one, data, 4, &port, &ip), 0u);
    EXPECT_TRUE(port == 1 && ip == 1);
    EXPECT_EQ(SocketSendTo(one, "first", 5, other.m_Address), 5u);
    EXPECT_EQ(SocketReceiveFrom(other, data, 3, other.m_Address), 3u);  // the rest of it is lost
    EXPECT_EQ(other.Port(), one.Port());                                // of the sender
    EXPECT_EQ(SocketSendTo(one, "ab", 2, one.m_Address), 2u);
    EXPECT_EQ(SocketReceive(one, data, 4, &port, &ip), 2u);
    EXPECT_TRUE(port == one.Port() && ip == kLoopback);
    EXPECT_STREQ(data, "abr");
}

// None of it becomes a call on descriptor 0, or on more bytes than there are.
TEST(Sockets, RefuseWhatIsNone) {
    char data[4];
    for (intptr_t number : {intptr_t{0}, intptr_t{-1}, intptr_t{1} << 32}) {
        _Socket* none = reinterpret_cast<_Socket*>(number);
        EXPECT_FALSE(DeleteSocket(none) || BindSocket(none, 0, 0) || ListenSocket(none, 0) ||
                     SetSocketNonBlocking(none, true) || ShutdownSocket(none, 3));
        EXPECT_EQ(SocketSend(none, data, 4) + SocketReceive(none, data, 4, nullptr, nullptr), 0u);
        EXPECT_EQ(errno, EBADF);
        EXPECT_EQ(AcceptSocket(none), kNoSocket);
    }
    Owned socket(ST_UDP);
    errno = 0;
    EXPECT_FALSE(BindSocket(socket, 65536 + 80, kLoopback) || NewSocketAddress(65536, 0) ||
                 SocketSendTo(socket, data, 4, nullptr) || SocketSend(socket, data, -1) ||
                 SocketReceiveFrom(socket, data, 4, nullptr) || DeleteSocketAddress(nullptr) ||
                 SocketAddressGetPort(nullptr) || SocketAddressGetIP(nullptr) ||
                 SocketReceive(socket, data, INT_MIN, nullptr, nullptr) || NewSocketSet(-1) ||
                 NewSocketSet(INT_MAX) || DeleteSocketSet(nullptr) ||
                 AddSocketSet(nullptr, socket, SE_READ) || SocketSetEvent(nullptr, 128) ||
                 GetSocketSetEvents(nullptr, 1));
    EXPECT_EQ(GetSocketError(), SERR_FAILED);
    EXPECT_EQ(NewSocket(static_cast<SocketType>(3)), kNoSocket);
    EXPECT_EQ(WaitSocketSet(nullptr, 0), -1);
}

// In a process of its own: it runs without the standard streams, and out of descriptors.
TEST(Sockets, KeepOffTheStandardStreamsAndSurviveTheLimitOfDescriptors) {
    auto body = [] {
        Pair pair;
        for (int fd : {0, 1, 2}) close(fd);
        Owned caller(ST_TCP), unanswered(ST_TCP);
        Set set(0), late(0);
        bool isFine = pair.m_Listener.Call(caller) && pair.m_Listener.Call(unanswered) &&
                      AddSocketSet(set, nullptr, 0) == 128;
        Owned accepted(AcceptSocket(pair.m_Listener));
        isFine = isFine && caller.Fd() > 2 && accepted.Fd() > 2;
        rlimit none = {3, 3};
        setrlimit(RLIMIT_NOFILE, &none);
        isFine = isFine && NewSocket(ST_TCP) == kNoSocket && GetSocketError() == SERR_FAILED &&
                 AcceptSocket(pair.m_Listener) == kNoSocket && !AddSocketSet(late, nullptr, 0) &&
                 !SocketSetEvent(late, 128) && SocketSetEvent(set, 128);
        for (int fd : {0, 1, 2}) isFine = isFine && fcntl(fd, F_GETFD) < 0;
        _exit(isFine ? 7 : 1);
    };
    EXPECT_EXIT(body(), testing::ExitedWithCode(7), "");
}

TEST(Sockets, AnswerForHosts) {
    char name[256];
    EXPECT_TRUE(GetHostName(name, sizeof(name)));
    EXPECT_FALSE(GetHostName(name, 0) || GetHostName(name, 1) || GetHostByAddr(0, name, 0));
    EXPECT_EQ(GetHostByName("127.0.0.1"), kLoopback);
    EXPECT_EQ(GetHostByName("no..name") + GetHostByName("::1") + GetHostByName(nullptr), 0u);
    // A machine may have no names for its addresses, not even for this one.
    if (!GetHostByAddr(kLoopback, name, sizeof(name))) return;
    for (size_t room : {size_t{1}, strlen(name), strlen(name) + 1}) {
        std::vector<char> copy(room + 1, '#');
        EXPECT_TRUE(GetHostByAddr(kLoopback, copy.data(), static_cast<int>(room)));
        EXPECT_TRUE(memcmp(copy.data(), name, room) == 0 && copy[room] == '#') << room;
    }
}

// A timer interrupts what the test's thread waits in, each millisecond.
TEST(Sockets, SignalsDoNotInterrupt) {
    static std::atomic<int> s_Count;
    struct sigaction action = {};  // without SA_RESTART
    action.sa_handler = [](int) { s_Count++; };
    sigaction(SIGALRM, &action, nullptr);
    auto interruptEach = [](int us) {
        itimerval timer = {{0, us}, {0, us}};
        setitimer(ITIMER_REAL, &timer, nullptr);
    };
    auto laterOn = [](auto act) {
        return std::thread([act] {
            sigset_t all;
            sigfillset(&all);
            pthread_sigmask(SIG_BLOCK, &all, nullptr);
            for (int seen = s_Count; s_Count < seen + 2;) std::this_thread::yield();
            act();
        });
    };
    Pair pair;
    Set set(1);
    AddSocketSet(set, pair.m_Far, SE_READ);
    Listener narrow(1);  // a full queue makes the connect below wait
    Owned first(ST_TCP), second(ST_TCP), waiting(ST_TCP);
    EXPECT_TRUE(narrow.Call(first) && narrow.Call(second));

    interruptEach(1000);
    unsigned long long start = GetTimeCount();
    EXPECT_EQ(WaitSocketSet(set, 50), 0);
    EXPECT_GE(GetTimeCount() - start, GetTimeFreq() / 20);
    char byte;
    std::thread sender = laterOn([&] { SocketSend(pair.m_Near, "x", 1); });
    EXPECT_EQ(SocketReceive(pair.m_Far, &byte, 1, nullptr, nullptr), 1u);
    sender.join();
    std::thread accepter = laterOn([&] {
        for (int i = 0; i < 3; i++) DeleteSocket(AcceptSocket(narrow));
    });
    EXPECT_TRUE(narrow.Call(waiting));
    accepter.join();
    interruptEach(0);
    signal(SIGALRM, SIG_DFL);
}

TEST(SocketSet, ReportsEvents) {
    Pair pair;
    Owned caller(ST_TCP), datagrams(ST_UDP);
    Set set(3);
    EXPECT_EQ(AddSocketSet(set, kNoSocket, 7), 0);
    EXPECT_EQ(AddSocketSet(set, pair.m_Listener, SE_ACCEPT), 1);
    EXPECT_EQ(AddSocketSet(set, datagrams, SE_READ | SE_ACCEPT), 2);
    EXPECT_EQ(AddSocketSet(set, pair.m_Far, SE_CLOSE | SE_CONNECT), 3);
    EXPECT_EQ(AddSocketSet(set, pair.m_Near, SE_WRITE), 0);  // it is full, and stays as it is
    for (int bad : {0, 4, -1, INT_MAX}) {
        ModifySocketSetEvents(set, bad, SE_WRITE);
        EXPECT_EQ(GetSocketSetEvents(set, bad), 0u);
    }
    auto expectOnly = [&](int index, unsigned events) {
        EXPECT_EQ(WaitSocketSet(set, index ? kLong : 0), index);
        EXPECT_EQ(GetSocketSetEvents(set, index), events);
        ModifySocketSetEvents(set, index, 0);
    };
    expectOnly(3, kWritable);
    expectOnly(0, 0);
    SocketSendTo(datagrams, "x", 1, datagrams.m_Address);
    expectOnly(2, kReadable);
    pair.m_Listener.Call(caller);
    expectOnly(1, kReadable);
    pair.m_Near.Delete();
    ShutdownSocket(pair.m_Far, 2);
    ModifySocketSetEvents(set, 3, SE_READ | SE_CLOSE);
    expectOnly(3, kReadable | SE_CLOSE);
    pair.m_Far.Delete();  // under the set: an error, which wakes and has no bit
    expectOnly(3, 0);
}

TEST(SocketSet, WakeUps) {
    Pair pair;
    Set set(1), wide(128);  // its last index would look like a wake-up
    EXPECT_EQ(AddSocketSet(wide, nullptr, 0), 0);
    EXPECT_FALSE(SocketSetEvent(set, 128));  // none is registered
    for (int number = 128; number < 256; number++) EXPECT_EQ(AddSocketSet(set, nullptr, 7), number);
    EXPECT_EQ(AddSocketSet(set, nullptr, 0), 0);
    EXPECT_EQ(AddSocketSet(set, pair.m_Far, SE_WRITE), 1);
    for (int bad : {0, 1, 127, 256, 128 + 256, -1, INT_MIN}) EXPECT_FALSE(SocketSetEvent(set, bad));
    for (int number : {255, 128, 191, 255, 192, 128}) EXPECT_TRUE(SocketSetEvent(set, number));
    for (int number : {255, 128, 191, 192}) {  // before the socket, in order, each once
        EXPECT_EQ(WaitSocketSet(set, kLong), number);
        EXPECT_EQ(GetSocketSetEvents(set, 1), kWritable);
    }
    EXPECT_EQ(WaitSocketSet(set, 0xFFFFFFFF), 1);
    EXPECT_TRUE(SocketSetEvent(set, 128));  // one that was waited for may be sent again
    EXPECT_EQ(WaitSocketSet(set, 0), 128);
}

// A waiter takes all the work it finds at each wake-up: none may be left when it sleeps.
TEST(SocketSet, NoWakeUpIsLost) {
    constexpr int kSenders = 4;
    constexpr int kRounds = 20000;
    Set set(0);
    std::atomic<int> work[kSenders]{};
    std::vector<std::thread> senders;
    for (int i = 0; i < kSenders; i++) {
        senders.emplace_back([&work, i, set = set.m_Set, number = AddSocketSet(set, nullptr, 0)] {
            for (int round = 0; round < kRounds; round++) {
                work[i].fetch_add(1, std::memory_order_relaxed);
                EXPECT_TRUE(SocketSetEvent(set, number));
            }
        });
    }
    for (int done = 0; done < kSenders * kRounds;) {
        int number = WaitSocketSet(set, kLong);
        ASSERT_GE(number, 128);
        done += work[number - 128].exchange(0, std::memory_order_relaxed);
    }
    for (std::thread& sender : senders) sender.join();
}

}  // namespace
}  // namespace Korvel::Platform
