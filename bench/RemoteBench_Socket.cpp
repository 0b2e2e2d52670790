// The least that a call can cost: messages of the same sizes over blocking sockets, once straight
// from the caller's thread, once with a hand-off to a connection's thread and back.
#include <arpa/inet.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <sys/socket.h>
#include <sys/uio.h>
#include <unistd.h>

#include <condition_variable>
#include <cstring>
#include <mutex>
#include <thread>
#include <utility>
#include <vector>

#include "RemoteBench.h"

namespace Korvel::Bench {
namespace {

constexpr size_t kBufferSize = 2 * kBlockSize;

// At the start of every message. The reply to it begins with the same bytes.
struct Header {
    Sizes m_Sizes;
    double m_Number;
};

sockaddr_in GetLoopback(uint16_t port) {
    sockaddr_in address{};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    return address;
}

int NewSocket() {
    return socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
}
void SetNoDelay(int socket) {
    int on = 1;
    setsockopt(socket, IPPROTO_TCP, TCP_NODELAY, &on, sizeof(on));
}

bool SendAll(int socket, std::span<iovec> parts) {
    msghdr message{};
    message.msg_iov = parts.data();
    message.msg_iovlen = parts.size();
    while (message.msg_iovlen) {
        ssize_t count = sendmsg(socket, &message, MSG_NOSIGNAL);
        if (count <= 0) return false;
        size_t sent = static_cast<size_t>(count);
        while (message.msg_iovlen && sent >= message.msg_iov->iov_len) {
            sent -= message.msg_iov->iov_len;
            message.msg_iov++;
            message.msg_iovlen--;
        }
        if (!message.msg_iovlen) break;
        message.msg_iov->iov_base = static_cast<char*>(message.msg_iov->iov_base) + sent;
        message.msg_iov->iov_len -= sent;
    }
    return true;
}

// Answers each message with its own first bytes, as many as it asks for.
void Answer(int socket) {
    std::unique_ptr<char[]> buffer(new char[kBufferSize]);
    std::vector<iovec> replies;
    size_t filled = 0;
    for (;;) {
        ssize_t count = recv(socket, &buffer[filled], kBufferSize - filled, 0);
        if (count <= 0) break;
        filled += static_cast<size_t>(count);
        replies.clear();
        size_t begin = 0;
        while (filled - begin >= sizeof(Header)) {
            Header header;
            memcpy(&header, &buffer[begin], sizeof(header));
            if (filled - begin < header.m_Sizes.m_Request) break;
            replies.push_back({&buffer[begin], header.m_Sizes.m_Reply});
            begin += header.m_Sizes.m_Request;
        }
        if (!SendAll(socket, replies)) break;
        filled -= begin;
        if (begin && filled) memmove(&buffer[0], &buffer[begin], filled);
    }
    close(socket);
}

uint16_t Serve() {
    int listener = NewSocket();
    sockaddr_in address = GetLoopback(0);
    socklen_t length = sizeof(address);
    auto* generic = reinterpret_cast<sockaddr*>(&address);
    if (bind(listener, generic, length) || listen(listener, 128) ||
        getsockname(listener, generic, &length)) {
        return 0;
    }
    std::thread([listener] {
        for (int socket; (socket = accept4(listener, nullptr, nullptr, SOCK_CLOEXEC)) >= 0;) {
            SetNoDelay(socket);
            std::thread(Answer, socket).detach();
        }
    }).detach();
    return ntohs(address.sin_port);
}

// A message of its header, then whatever fills it up.
class Message {
public:
    Message(Sizes sizes, double number, std::span<const char> filling)
        : m_Header{sizes, number},
          m_Parts{{&m_Header, sizeof(m_Header)},
                  {const_cast<char*>(filling.data()), sizes.m_Request - sizeof(m_Header)}} {}

    bool Send(int socket) { return SendAll(socket, m_Parts); }

    // The reply goes into the buffer, which is large enough.
    bool Receive(int socket, char* buffer) const {
        size_t filled = 0;
        while (filled < m_Header.m_Sizes.m_Reply) {
            ssize_t count = recv(socket, buffer + filled, m_Header.m_Sizes.m_Reply - filled, 0);
            if (count <= 0) return false;
            filled += static_cast<size_t>(count);
        }
        return memcmp(buffer, &m_Header, sizeof(m_Header)) == 0;
    }

private:
    Header m_Header;
    iovec m_Parts[2];
};

class SocketLink : public Link {
public:
    explicit SocketLink(int socket) : m_Socket(socket) {}
    ~SocketLink() override { close(m_Socket); }

    bool Call(double number) override {
        static const Sizes sizes = GetCallSizes();
        static const std::vector<char> filling(sizes.m_Request);
        Message message(sizes, number, filling);
        return Exchange(message);
    }
    // The filling is the block; what goes before and after it is as many bytes elsewhere.
    bool Block(std::span<const char> block) override {
        static const Sizes sizes = GetBlockSizes();
        if (m_Filling.empty()) {
            m_Filling.assign(block.begin(), block.end());
            m_Filling.resize(sizes.m_Request);
        }
        Message message(sizes, 0, m_Filling);
        return Exchange(message);
    }

protected:
    virtual bool Exchange(Message& message) = 0;

    const int m_Socket;
    const std::unique_ptr<char[]> m_Buffer{new char[kBufferSize]};

private:
    std::vector<char> m_Filling;
};

class BareLink : public SocketLink {
public:
    using SocketLink::SocketLink;

private:
    bool Exchange(Message& message) override {
        std::lock_guard guard(m_Lock);
        return message.Send(m_Socket) && message.Receive(m_Socket, m_Buffer.get());
    }

    std::mutex m_Lock;
};

// The connection's thread takes all that wait, sends it, and hands back each reply as it comes.
class HandOffLink : public SocketLink {
public:
    using SocketLink::SocketLink;
    ~HandOffLink() override {
        {
            std::lock_guard guard(m_Lock);
            m_IsEnding = true;
            m_HasWork.notify_one();
        }
        m_Thread.join();
    }

private:
    struct Request {
        Message* m_Message;
        bool m_IsDone = false;
        bool m_IsGood = false;
        std::condition_variable m_Done;
    };

    bool Exchange(Message& message) override {
        Request request{.m_Message = &message, .m_Done = {}};
        {
            std::lock_guard guard(m_Lock);
            m_Queue.push_back(&request);
        }
        m_HasWork.notify_one();
        std::unique_lock lock(m_Lock);
        request.m_Done.wait(lock, [&] { return request.m_IsDone; });
        return request.m_IsGood;
    }

    void Run() {
        std::vector<Request*> requests;
        std::unique_lock lock(m_Lock);
        while (!m_IsEnding) {
            m_HasWork.wait(lock, [&] { return m_IsEnding || !m_Queue.empty(); });
            requests.clear();
            std::swap(requests, m_Queue);
            lock.unlock();
            for (Request* request : requests)
                request->m_IsGood = request->m_Message->Send(m_Socket);
            for (Request* request : requests) {
                bool isGood =
                    request->m_IsGood && request->m_Message->Receive(m_Socket, m_Buffer.get());
                std::lock_guard guard(m_Lock);
                request->m_IsGood = isGood;
                request->m_IsDone = true;
                request->m_Done.notify_one();  // under the lock: then the request may be gone
            }
            lock.lock();
        }
    }

    std::mutex m_Lock;
    std::condition_variable m_HasWork;
    std::vector<Request*> m_Queue;
    bool m_IsEnding = false;
    std::thread m_Thread{[this] { Run(); }};
};

template <class SomeLink>
std::unique_ptr<Link> Open(uint16_t port, bool) {
    int socket = NewSocket();
    sockaddr_in address = GetLoopback(port);
    if (connect(socket, reinterpret_cast<sockaddr*>(&address), sizeof(address))) {
        close(socket);
        return nullptr;
    }
    SetNoDelay(socket);
    return std::make_unique<SomeLink>(socket);
}

}  // namespace

const Variant kBareSocket{"bare", Serve, Open<BareLink>};
const Variant kHandOff{"hand-off", Serve, Open<HandOffLink>};

}  // namespace Korvel::Bench
