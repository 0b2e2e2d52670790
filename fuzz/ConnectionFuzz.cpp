// What a peer may send, as a stream for a connection at work: raw bytes, or packets with headers
// that are right. Members are called, objects passed, kept and made, requests of ours answered.
// Whatever comes, the connection ends in time, what it has written is whole packets, every callback
// has run once and nothing stays counted.
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <iterator>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "Platform/NetworkingInternal.h"
#include "core/RefObject.h"
#include "objects/Publish.h"
#include "objects/ScriptConfig.h"
#include "remote/Packets.h"
#include "remote/RemoteApp.h"

using namespace Korvel;

namespace {

constexpr int kLimitMs = 20000;
constexpr int kNumRequests = 4;  // of ours, which have these numbers from 1 on

void Check(bool holds) {
    if (!holds) abort();
}

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
    void GetObjectInfo(const ScriptVal& query, ScriptVal& result) override { result[1] = query; }

    std::atomic<int> m_Count{1};

    static inline std::atomic<int> s_NumAlive{0};
    static inline ScriptVal s_Kept;
    static inline std::vector<ScriptArgs*> s_Deferred;
};

KORVEL_PUBLISH(Box, "Box", "Is served.", "")
KORVEL_OPCODE(Box, SST_Call, SSF_AnyThread) {
    args.Return(args[1]);
    args.Return(args[2]);
}
KORVEL_OPCODE(Box, SST_Add, SSF_AnyThread) {
    Box* made = new Box;
    args.ReturnObject(made);
    made->DecRef();
}
KORVEL_OPCODE(Box, SST_Sub, SSF_AnyThread) {
    Box::s_Kept = args[1];
}
KORVEL_OPCODE(Box, SST_Mul, SSF_AnyThread) {
    args.Return(Box::s_Kept);
    args.SetError(SCERR_InvalidArgs, "told");
}
KORVEL_OPCODE(Box, SST_Div, SSF_AnyThread) {  // calls back
    const ScriptVal& proxy = args[1];
    ScriptArgs more;
    more.SetArguments(&self);
    if (proxy.IsRemoteObject()) {
        proxy.ToRemoteObject()->DoCommandAsync(SST_Call, more, nullptr, nullptr);
    }
}
KORVEL_OPCODE(Box, SST_Concat, SSF_AnyThread) {
    if (ScriptArgs* deferred = args.DeferReply()) Box::s_Deferred.push_back(deferred);
}
KORVEL_OPCODE(Box, SST_Unm, SSF_AnyThread) {
    for (ScriptArgs* deferred : std::exchange(Box::s_Deferred, {})) {
        deferred->SendReply();
        delete deferred;
    }
}
KORVEL_FUNCTION(Box, Text, SSF_AnyThread) {
    args.Return("a text");
}
KORVEL_PUBLISHED(Box);

// Keeps the numbers of some objects as they are.
class Keeper : public RemoteApp {
public:
    Keeper() : RemoteApp("keeper", 0, nullptr) {}
    bool Connected() const override { return true; }
};

std::atomic<int> s_NumCalled{0};

bool OnReply(void*, RemoteApp* app, Packet* reply, unsigned int) {
    s_NumCalled++;
    if (!reply) return false;
    ScriptVal result;
    ScriptVal::FromPacket(app, reply, nullptr, &result);
    FreePkt(reply);
    return true;
}

// All that lasts from one run to the next.
struct Process {
    Process() {
        Check(freopen("/dev/null", "w", stdout) != nullptr);  // for traces
        m_Config.GetApp = [](void* process, TagList*) -> ScriptObject* {
            return static_cast<Process*>(process)->m_Objects[0];
        };
        m_Config.UIExecute = [](ScriptConfig::UIFunction function, void* a, void* b, bool) {
            return function(a, b);
        };
        m_Config.m_UserData = this;
        for (Box*& box : m_Objects) box = new Box;
        g_ScriptConfig = &m_Config;
        m_Keeper = new Keeper;
        for (Box* box : m_Objects) m_Keeper->_IncLocalRef(box);
    }

    static constexpr int kNumObjects = 3;
    Box* m_Objects[kNumObjects];  // 1 and, on any connection that knows them, 2 and 3
    ScriptConfig m_Config;
    Keeper* m_Keeper;
};

struct Input {
    uint8_t Next() { return m_Size ? (m_Size--, *m_Data++) : 0; }

    const uint8_t* m_Data;
    size_t m_Size;
};

// Packets with headers that are right, around bytes that need not be.
std::string MakePackets(Input in) {
    static const uint32_t types[] = {
        PKT_Script, PKT_Script,     PKT_Script,        PKT_Reply,        PKT_IncRef,
        PKT_DecRef, PKT_NoMoreRefs, PKT_GetObjectInfo, PKT_SetStateData, PKT_DoNothing};
    std::string stream;
    while (in.m_Size) {
        uint8_t code = in.Next();
        Packet header = {};
        header.m_Type = types[code % 16 % std::size(types)];
        header.m_Symbol = in.Next();
        header.m_Target = in.Next();
        header.m_Context = in.Next();
        header.m_Flags = code & 0x10 ? PKF_Trace : 0;
        std::string values(code & 0x20 ? 4 : 0, '\0');
        for (size_t left = in.Next(); left > 0 && in.m_Size; left--) {
            values += static_cast<char>(in.Next());
        }
        values.append(code & 0x40 ? 4 : 0, '\0');
        header.m_Size = static_cast<uint32_t>(sizeof header + values.size());
        stream.append(reinterpret_cast<char*>(&header), sizeof header).append(values);
    }
    return stream;
}

// Both ends of a stream; one of them as a socket for a connection.
struct Ends {
    Ends() {
        int fds[2];
        Check(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) == 0);
        m_Near = Platform::NewSocket(Platform::ST_TCP);
        Check(dup3(fds[0], Platform::SocketDescriptor(m_Near), O_CLOEXEC) >= 0);
        close(fds[0]);
        m_Far = fds[1];
    }
    ~Ends() { close(m_Far); }

    Platform::_Socket* m_Near;
    int m_Far;
};

// Sends it all and ends; returns what the other side has written until it ended.
std::string Exchange(int socket, std::string_view toSend) {
    std::string received;
    char buffer[4096];
    if (toSend.empty()) shutdown(socket, SHUT_WR);
    for (;;) {
        int events = toSend.empty() ? POLLIN : POLLIN | POLLOUT;
        pollfd entry = {socket, static_cast<short>(events), 0};
        Check(poll(&entry, 1, kLimitMs) == 1);
        if (entry.revents & POLLIN || toSend.empty()) {
            ssize_t size = recv(socket, buffer, sizeof buffer, MSG_DONTWAIT);
            if (size <= 0) return received;
            received.append(buffer, static_cast<size_t>(size));
            continue;
        }
        ssize_t sent = send(socket, toSend.data(), toSend.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
        toSend.remove_prefix(sent > 0 ? static_cast<size_t>(sent) : toSend.size());
        if (toSend.empty()) shutdown(socket, SHUT_WR);
    }
}

// The last packet may have been cut off by the end.
void CheckPackets(const std::string& stream) {
    for (size_t at = 0; at + sizeof(Packet) <= stream.size();) {
        uint32_t size;
        memcpy(&size, stream.data() + at, sizeof size);
        Check(size >= kMinPacketSize);
        if (size > stream.size() - at) return;
        Packet* packet = AllocPkt(size);
        memcpy(static_cast<void*>(packet), stream.data() + at, size);
        at += size;
        Check(packet->m_Type <= PKT_SetStateData || packet->m_Type == PKT_Reply);
        Check(packet->m_Context != 0 || packet->m_Type == PKT_Reply);
        ScriptVal first, second;
        Check(ScriptVal::FromPacket(static_cast<RemoteApp*>(nullptr), packet, &first, &second));
        Check(first.IsNil());
        FreePkt(packet);
    }
}

template <class Condition>
void WaitUntil(Condition condition) {
    for (int i = 0; !condition(); i++) {
        Check(i < kLimitMs * 20);
        usleep(50);
    }
}

void Run(Process& process, const std::string& stream) {
    auto& app = *new RemoteApp("fuzz", 0, nullptr);
    s_NumCalled = 0;
    std::string received;
    {
        Ends ends;
        Check(app.Connect(ends.m_Near));
        for (Box* box : process.m_Objects) app._IncLocalRef(box);
        ScriptArgs args;
        args.SetArguments(process.m_Objects[1]);
        ScriptVal root = app.FindRemoteObject(1);
        for (int i = 0; i < kNumRequests; i++) {
            Check(root.ToRemoteObject()->DoCommandAsync(SST_Call, args, OnReply, nullptr) != 0);
        }
        root = SV_Nil;
        received = Exchange(ends.m_Far, stream);
    }
    WaitUntil([&app] { return !app.Connected(); });
    Box::s_Kept = SV_Nil;
    for (ScriptArgs* deferred : std::exchange(Box::s_Deferred, {})) delete deferred;
    WaitUntil([&app] { return app.GetUseCount() == 1; });
    app.Recycle();
    Check(s_NumCalled == kNumRequests);
    Check(Box::s_NumAlive == Process::kNumObjects);
    for (Box* box : process.m_Objects) Check(box->m_Count == 2);  // ours, and the keeper's
    CheckPackets(received);
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
    static Process& process = *new Process;
    if (size == 0) return 0;
    Input in{data + 1, size - 1};
    process.m_Config.m_Active = data[0] & 1;
    bool isRaw = data[0] & 2;
    Run(process,
        isRaw ? std::string(reinterpret_cast<const char*>(in.m_Data), in.m_Size) : MakePackets(in));
    return 0;
}
