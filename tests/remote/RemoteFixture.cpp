#include "RemoteFixture.h"

#include <dirent.h>
#include <malloc.h>

#include <cstdlib>
#include <fstream>
#include <iterator>
#include <string>

#include "Platform/Time.h"
#include "core/0ReusePool.h"
#include "diag/Env.h"

namespace Korvel::Test {

KORVEL_PUBLISH(Box, "Box", "Answers.", "")
KORVEL_OPCODE(Box, SST_Call, SSF_AnyThread) {
    args.Return(args[1]);
}
KORVEL_OPCODE(Box, SST_Add, SSF_AnyThread) {
    Box* made = new Box;
    args.ReturnObject(made);
    if (made) made->DecRef();  // memory may have run out
}
KORVEL_OPCODE(Box, SST_Sub, SSF_AnyThread) {
    Box::Stop();
    args.ReturnNumber(1);
}
KORVEL_OPCODE(Box, SST_Concat, SSF_AnyThread) {
    Box::s_Deferred = args.DeferReply();
    Box::s_Entered.Signal();
}
KORVEL_OPCODE(Box, SST_Div, SSF_AnyThread) {
    args.SetError(SCERR_InvalidArgs, "told");
}
// Calls back on the connection that it is called on, or on the other one of the pair, which cannot
// be.
KORVEL_OPCODE(Box, SST_Pow, SSF_AnyThread) {
    ScriptArgs inner;
    RemoteApp* through = Box::s_Through ? Box::s_Through : args.GetApp();
    ScriptVal result, root = through->FindRemoteObject(1);
    args.ReturnBoolean(root.ToRemoteObject()->DoCommand(SST_Call, inner, result));
}
KORVEL_OPCODE(Box, SST_CallFunction, 0) {}  // on the UI thread, where there is one
KORVEL_OPCODE(Box, SST_ToString, SSF_AnyThread) {
    args.ReturnString("a box");
}
KORVEL_PUBLISHED(Box);

bool WaitUntil(const std::function<bool()>& isSo) {
    for (unsigned int ms = 0; !isSo(); ms++) {
        if (ms == kLimitMs) return false;
        Platform::Wait(1);
    }
    return true;
}

bool IsAsleep(pid_t thread) {
    std::ifstream file("/proc/self/task/" + std::to_string(thread) + "/stat");
    std::string text(std::istreambuf_iterator<char>(file), {});
    return text.empty() || text.find(") S") != std::string::npos;
}

void Setting::Set(const char* value) const {
    setenv(m_Name, value, 1);
    EnvVar::InvalidateEnv();
}

int CountDescriptors() {
    DIR* dir = opendir("/proc/self/fd");
    int count = 0;
    while (readdir(dir)) count++;
    closedir(dir);
    return count - 3;  // two dots, and the folder's own
}

size_t CountBytes() {
    g_ReusePoolMgr.FreeAll();
    return mallinfo2().uordblks;
}

namespace {

Box* s_Root;

}  // namespace

BoxHost::BoxHost() {
    s_Root = m_Root;
    m_Config.GetApp = [](void*, TagList*) -> ScriptObject* { return s_Root; };
    g_ScriptConfig = &m_Config;
}

BoxHost::~BoxHost() {
    m_Root->DecRef();
    EXPECT_TRUE(WaitUntil([] { return Box::s_NumAlive == 0; }));
    g_ScriptConfig = nullptr;
}

Listener::Listener() {
    using namespace Platform;
    EXPECT_TRUE(BindSocket(m_Socket, 0, kLoopback) && ListenSocket(m_Socket, 0));
    _SocketAddress* address = GetSocketAddress(m_Socket);
    m_Port = SocketAddressGetPort(address);
    DeleteSocketAddress(address);
}

Platform::_Socket* Listener::Connect() const {
    Platform::_Socket* socket = Platform::NewSocket(Platform::ST_TCP);
    EXPECT_TRUE(Platform::ConnectSocket(socket, m_Port, kLoopback));
    Platform::SetSocketNoDelay(socket, true);
    return socket;
}

bool Link::Connect() {
    if (m_IsInProcess) return RemoteApp::Join(m_Near, m_Far);
    Ends ends;
    return m_Near->Connect(ends.m_Near) && m_Far->Connect(ends.m_Far);
}

void Link::End() {
    for (RemoteApp* app : {m_Near, m_Far}) app->_Disconnect(kLimitMs);
    EXPECT_FALSE(m_Near->Connected() || m_Far->Connected());
}

Link::~Link() {
    End();
    for (RemoteApp* app : {m_Near, m_Far}) app->Recycle();
}

Bare::Bare() {
    m_App->SetTimeOut(kLimitMs / 1000);
    Reconnect();
}

void Bare::Reconnect() {
    Close();
    Ends ends;
    m_Socket = ends.m_Near;
    EXPECT_TRUE(m_App->Connect(ends.m_Far));
}

Bare::~Bare() {
    Close();
    m_App->_Disconnect(kLimitMs);
    m_App->Recycle();
}

void Bare::Close(bool abruptly) {
    if (!m_Socket) return;
    if (abruptly) Platform::SetSocketLinger(m_Socket, true, 0);
    Platform::DeleteSocket(std::exchange(m_Socket, nullptr));
}

void Bare::Send(const void* bytes, uint32_t length) const {
    auto* rest = static_cast<char*>(const_cast<void*>(bytes));
    while (length > 0) {
        int sent = Platform::SocketSend(m_Socket, rest, static_cast<int>(length));
        if (sent <= 0) return;  // the connection has closed
        rest += sent;
        length -= static_cast<uint32_t>(sent);
    }
}

void Bare::Send(Packet* packet) const {
    Send(packet, packet->m_Size);
    FreePkt(packet);
}

Packet* Bare::Receive() const {
    auto receive = [this](void* to, uint32_t length) {
        auto* place = static_cast<char*>(to);
        while (length > 0) {
            int count = Platform::SocketReceive(m_Socket, place, static_cast<int>(length), nullptr,
                                                nullptr);
            if (count <= 0) return false;
            place += count;
            length -= static_cast<uint32_t>(count);
        }
        return true;
    };
    uint32_t size;
    if (!receive(&size, sizeof size)) return nullptr;
    Packet* packet = AllocPkt(size);
    packet->m_Size = size;
    if (receive(&packet->m_Type, size - sizeof size)) return packet;
    FreePkt(packet);
    return nullptr;
}

ScriptVal Bare::Ask(uint32_t type, uint32_t symbol, uint32_t target, const ScriptVal& second) {
    Packet* packet = CreatePkt(type, nullptr, nullptr, &second);
    packet->m_Symbol = symbol;
    packet->m_Target = target;
    packet->m_Context = ++m_Context;
    Send(packet);
    ScriptVal result;
    if (Packet* reply = Receive()) {
        EXPECT_EQ(reply->m_Context, m_Context);
        EXPECT_TRUE(
            ScriptVal::FromPacket(static_cast<RemoteApp*>(nullptr), reply, nullptr, &result));
        FreePkt(reply);
    }
    return result;
}

}  // namespace Korvel::Test
