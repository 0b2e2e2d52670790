// Addresses of machines, as texts and as numbers.
#include <strings.h>

#include <algorithm>
#include <array>
#include <bit>
#include <cstdio>
#include <cstring>

#include "Platform/NetworkingInternal.h"
#include "remote/RemoteApp.h"
#include "remote/TrafficInternal.h"

namespace Korvel {
namespace {

constexpr int kHostNameSize = 256;

const unsigned int kLoopback = std::bit_cast<unsigned int>(std::array<uint8_t, 4>{127, 0, 0, 1});

}  // namespace

unsigned int RemoteApp::IPFromStr(const char* text) {
    if (!text) return 0;
    const char* next = text;
    auto skipBlanks = [&] { next += strspn(next, " \t"); };
    std::array<uint8_t, 4> bytes;
    for (size_t i = 0; i < bytes.size(); i++) {
        if (i && *next++ != '.') return Platform::GetHostByName(text);
        skipBlanks();
        int number = *next >= '0' && *next <= '9' ? 0 : 256;
        while (*next >= '0' && *next <= '9' && number < 256) number = number * 10 + *next++ - '0';
        if (number > 255) return Platform::GetHostByName(text);
        bytes[i] = static_cast<uint8_t>(number);
        skipBlanks();
    }
    if (*next == '.') next++;
    skipBlanks();
    return *next ? Platform::GetHostByName(text) : std::bit_cast<unsigned int>(bytes);
}

int RemoteApp::StrFromIP(unsigned int ip, char* text, int length) {
    if (!text || length <= 0) return 0;
    auto bytes = std::bit_cast<std::array<uint8_t, 4>>(ip);
    int written = snprintf(text, static_cast<size_t>(length), "%d.%d.%d.%d", bytes[0], bytes[1],
                           bytes[2], bytes[3]);
    return std::min(written, length - 1);
}

// A machine that calls itself does so from the address that it calls.
bool RemoteApp::IsPeerLocal() const {
    AutoAppLock guard(m_Lock);
    Platform::_Socket* socket = m_Traffic->m_Socket;
    if (socket == kInProcess) return true;
    unsigned int ip = Platform::GetSocketPeerIP(socket, nullptr);
    Platform::_SocketAddress* own = Platform::GetSocketAddress(socket);
    unsigned int ownIP = Platform::SocketAddressGetIP(own);
    Platform::DeleteSocketAddress(own);
    return ip && (Platform::IsLoopback(ip) || ip == ownIP);
}

bool RemoteApp::IsLocalIP(unsigned int ip) {
    if (ip == kLoopback) return true;
    char own[kHostNameSize] = "";
    char name[kHostNameSize] = "";
    return Platform::GetHostName(own, kHostNameSize - 1) &&
           Platform::GetHostByAddr(ip, name, kHostNameSize - 1) && strcasecmp(own, name) == 0;
}

bool RemoteApp::IsLocalIP(const char* address) {
    if (!address) return false;
    return strcmp(address, "127.0.0.1") == 0 || IsLocalIP(IPFromStr(address));
}

}  // namespace Korvel
