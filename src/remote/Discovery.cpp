// Asking by datagram who is there.
#include <algorithm>
#include <climits>
#include <cstring>
#include <map>
#include <string>
#include <vector>

#include "Platform/Lock.h"
#include "Platform/NetworkingInternal.h"
#include "Platform/Threads.h"
#include "core/RefObject.h"
#include "core/ScriptTextInternal.h"
#include "remote/DiscoveryInternal.h"
#include "remote/RemoteApp.h"
#include "remote/ScriptApp.h"
#include "remote/ScriptServer.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr unsigned int kEverybody = 0xFFFFFFFF;
constexpr unsigned int kMaxAnswers = 4096;
constexpr double kMaxTimeOut = INT_MAX / 1000;  // in seconds
constexpr int kHostNameSize = 128;

// Finds the names of machines, one after the other. Name servers may take longer than whoever wants
// the names can wait, so a thread of its own does it, and keeps it alive when nobody else does.
class NameFinder : public RefCount {
public:
    // Begins to look for a name, unless it did before.
    void Find(unsigned int ip);
    // What has been found by then; empty for nothing. Find has no effect after Stop.
    std::string GetName(unsigned int ip) const;
    void Stop();

private:
    static unsigned long long Run(void* finder);
    bool TakeNext(unsigned int& ip);

    mutable KorvelScript::Lock m_Lock;

    // Guarded by m_Lock
    std::map<unsigned int, std::string> m_Names;
    std::vector<unsigned int> m_Wanted;
    bool m_IsRunning = false;
};

void NameFinder::Find(unsigned int ip) {
    KorvelScript::AutoLock guard(m_Lock);
    if (!m_Names.try_emplace(ip).second) return;
    m_Wanted.push_back(ip);
    if (m_IsRunning) return;
    Use();
    Platform::_Thread* thread = Platform::NewThread(Run, this, 0, nullptr);
    if (!thread) return Recycle();
    Platform::DeleteThread(thread);
    m_IsRunning = true;
}

std::string NameFinder::GetName(unsigned int ip) const {
    KorvelScript::AutoLock guard(m_Lock);
    auto found = m_Names.find(ip);
    return found != m_Names.end() ? found->second : std::string();
}

void NameFinder::Stop() {
    KorvelScript::AutoLock guard(m_Lock);
    m_Wanted.clear();
}

bool NameFinder::TakeNext(unsigned int& ip) {
    KorvelScript::AutoLock guard(m_Lock);
    m_IsRunning = !m_Wanted.empty();
    if (!m_IsRunning) return false;
    ip = m_Wanted.back();
    m_Wanted.pop_back();
    return true;
}

unsigned long long NameFinder::Run(void* pointer) {
    ptr<NameFinder> finder(static_cast<NameFinder*>(pointer));
    Platform::SetThreadName("Ping [Names]", nullptr);
    unsigned int ip;
    while (finder->TakeNext(ip)) {
        char name[kHostNameSize] = "";
        if (!Platform::GetHostByAddr(ip, name, kHostNameSize - 1)) continue;
        KorvelScript::AutoLock guard(finder->m_Lock);
        finder->m_Names[ip] = name;
    }
    return 0;
}

// One question, and the answers to it.
class Question {
public:
    Question() = default;
    Question(const Question&) = delete;
    Question& operator=(const Question&) = delete;
    ~Question() {
        m_Names->Stop();
        Platform::DeleteSocketSet(m_Set);
        if (m_Socket != Platform::kNoSocket) Platform::DeleteSocket(m_Socket);
    }

    bool Send(const char* name, unsigned int ip);
    // Takes what comes until the deadline, as NowNs tells it.
    void Receive(int64_t deadlineNs, ScriptVal& result);

private:
    void Take(char* text, unsigned int ip, ScriptVal& answer);
    void NameHosts(ScriptVal& result) const;

    Platform::_Socket* const m_Socket = Platform::NewSocket(Platform::ST_UDP);
    Platform::_SocketSet* const m_Set = Platform::NewSocketSet(1);
    ptr<NameFinder> m_Names{new NameFinder};
    std::vector<unsigned int> m_Nameless;  // the address for each answer without a name, else 0
};

bool Question::Send(const char* name, unsigned int ip) {
    std::string text(kQuestionMagic);
    if (name) text += name;
    if (text.size() > kMaxDatagram) return false;  // no host has such a name
    if (!Platform::AddSocketSet(m_Set, m_Socket, Platform::SE_READ)) return false;
    Platform::SetSocketNonBlocking(m_Socket, true);
    if (ip == kEverybody) Platform::SetSocketBroadcast(m_Socket, true);
    Platform::_SocketAddress* address = Platform::NewSocketAddress(g_ScriptServerPort, ip);
    unsigned int sent =
        Platform::SocketSendTo(m_Socket, text.data(), static_cast<int>(text.size()), address);
    Platform::DeleteSocketAddress(address);
    return sent > 0;
}

void Question::Receive(int64_t deadlineNs, ScriptVal& result) {
    unsigned int count = 0;
    for (int64_t now; (now = NowNs()) < deadlineNs && count < kMaxAnswers;) {
        auto leftMs = static_cast<unsigned int>((deadlineNs - now + kNsPerMs - 1) / kNsPerMs);
        if (Platform::WaitSocketSet(m_Set, leftMs) < 0) break;
        char bytes[kMaxDatagram + 1];
        unsigned int port, ip = 0;
        unsigned int length = Platform::SocketReceive(m_Socket, bytes, kMaxDatagram, &port, &ip);
        if (length < kMagicSize || memcmp(bytes, kAnswerMagic, kMagicSize) != 0) continue;
        bytes[length] = 0;
        Take(bytes + kMagicSize, ip, result[++count]);
    }
    NameHosts(result);
}

// A text that is no table says no more than that somebody is there.
void Question::Take(char* text, unsigned int ip, ScriptVal& answer) {
    if (*text == '{') FromForeignText(answer, text, nullptr, 0);
    answer.Ensure(SV_Table);
    char address[16];
    RemoteApp::StrFromIP(ip, address, sizeof address);
    answer["IP"] = address;
    bool isNamed = !answer.FindKeyConst("HostName").IsNil();
    m_Nameless.push_back(isNamed ? 0 : ip);
    if (!isNamed) m_Names->Find(ip);
}

void Question::NameHosts(ScriptVal& result) const {
    for (size_t i = 0; i < m_Nameless.size(); i++) {
        std::string name = m_Nameless[i] ? m_Names->GetName(m_Nameless[i]) : std::string();
        if (!name.empty()) result[i + 1]["HostName"] = name.c_str();
    }
}

}  // namespace

bool Ping(const char* name, double timeOut, ScriptVal& result, unsigned int ip) {
    double seconds = timeOut > 0 ? std::min(timeOut, kMaxTimeOut) : 0;
    int64_t deadlineNs = NowNs() + static_cast<int64_t>(seconds * 1e9);
    result = ScriptVal(SV_Table, nullptr);
    Question question;
    if (!question.Send(name, ip)) return false;
    question.Receive(deadlineNs, result);
    return true;
}

}  // namespace Korvel
