#pragma once

// What the tests of connections share.
#include <gtest/gtest.h>
#include <sys/types.h>

#include <atomic>
#include <functional>

#include "Platform/Event.h"
#include "Platform/Networking.h"
#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

namespace Korvel::Test {

constexpr unsigned int kLimitMs = 60000;
constexpr unsigned int kLoopback = 0x0100007F;  // 127.0.0.1 in network order

// Looks until something is so that other threads bring about; false when it takes too long.
bool WaitUntil(const std::function<bool()>& isSo);

// Whether a thread of this process waits for something, or has ended.
bool IsAsleep(pid_t thread);

// The descriptors that the process has open.
int CountDescriptors();

// The bytes that it has in use; a sanitizer's malloc does not tell.
size_t CountBytes();

// Gives a setting another value while it lives.
class Setting {
public:
    Setting(const char* name, const char* value, const char* standard)
        : m_Name(name), m_Standard(standard) {
        Set(value);
    }
    Setting(const Setting&) = delete;
    Setting& operator=(const Setting&) = delete;
    ~Setting() { Set(m_Standard); }

private:
    void Set(const char* value) const;

    const char* const m_Name;
    const char* const m_Standard;
};

// An object that is served. It lives as long as somebody counts it.
class Box : public Scripted<_Object> {
    KORVEL_SCRIPTED(Box)
public:
    Box() {
        SetScriptClass();
        s_NumAlive++;
    }
    ~Box() override { s_NumAlive--; }
    void IncRef() override { m_Count++; }
    void DecRef() override {
        if (--m_Count == 0) delete this;
    }
    void GetObjectInfo(const ScriptVal& query, ScriptVal& result) override {
        if (query == "wait") Stop();
        result[1] = query;
    }
    static void Stop() {
        s_Entered.Signal();
        s_Gate.Wait(kLimitMs);
    }

    int GetCount() const { return m_Count; }

    static inline std::atomic<int> s_NumAlive{0};
    static inline KorvelScript::Event s_Entered;
    static inline KorvelScript::Event s_Gate;
    static inline ScriptArgs* s_Deferred = nullptr;
    static inline RemoteApp* s_Through = nullptr;  // where SST_Pow calls; else where it was called

private:
    std::atomic<int> m_Count{1};
};

// While it lives, a configuration is installed whose application object is a box.
class BoxHost {
public:
    BoxHost();
    BoxHost(const BoxHost&) = delete;
    BoxHost& operator=(const BoxHost&) = delete;
    ~BoxHost();  // all boxes must go

    ScriptConfig m_Config;
    Box* const m_Root = new Box;
};

// Listens on a port of the system's choice.
class Listener {
public:
    Listener();
    Listener(const Listener&) = delete;
    Listener& operator=(const Listener&) = delete;
    ~Listener() { Platform::DeleteSocket(m_Socket); }
    Platform::_Socket* Accept() const { return Platform::AcceptSocket(m_Socket); }
    Platform::_Socket* Connect() const;  // a new socket

    Platform::_Socket* const m_Socket = Platform::NewSocket(Platform::ST_TCP);
    unsigned int m_Port;
};

// The two ends of a TCP connection of this machine; whoever takes one closes it.
struct Ends {
    Ends() : Ends(Listener()) {}
    explicit Ends(const Listener& listener)
        : m_Near(listener.Connect()), m_Far(listener.Accept()) {}
    Platform::_Socket* m_Near;
    Platform::_Socket* m_Far;
};

// Two connections with each other, over a socket or within the process.
class Link {
public:
    explicit Link(bool isInProcess) : m_IsInProcess(isInProcess) { EXPECT_TRUE(Connect()); }
    Link(const Link&) = delete;
    Link& operator=(const Link&) = delete;
    ~Link();  // ends both

    bool Connect();  // once more
    void End();

    RemoteApp* const m_Near = new RemoteApp("near", 0, nullptr);
    RemoteApp* const m_Far = new RemoteApp("far", 0, nullptr);

private:
    const bool m_IsInProcess;
};

// A connection beside the socket of a peer that the test plays.
class Bare {
public:
    Bare();
    Bare(const Bare&) = delete;
    Bare& operator=(const Bare&) = delete;
    ~Bare();  // ends both

    void Send(const void* bytes, uint32_t length) const;
    void Send(Packet* packet) const;  // takes it over
    // The next packet from the connection; null at its end. Freed by FreePkt.
    Packet* Receive() const;
    // Sends a packet with a symbol and a target, and gives the second value of its reply.
    ScriptVal Ask(uint32_t type, uint32_t symbol, uint32_t target, const ScriptVal& second = {});
    void Close(bool abruptly = false);  // the peer's end
    void Reconnect();                   // the same connection to another peer

    RemoteApp* m_App = new RemoteApp("served", 0, nullptr);
    Platform::_Socket* m_Socket = nullptr;

private:
    uint32_t m_Context = 0;
};

}  // namespace Korvel::Test
