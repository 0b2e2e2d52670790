// The column of RemoteBench.cpp for Cap'n Proto RPC. Its connections belong to the event loop of a
// thread: a caller runs the loop of its own, and threads that share a connection give their calls
// to the thread that has it.
#include <capnp/ez-rpc.h>
#include <kj/async.h>

#include <future>
#include <thread>
#include <utility>

#include "RemoteBench.h"
#include "RemoteBench_CapnProto.capnp.h"

namespace Korvel::Bench {
namespace {

class EchoServer final : public ::Echo::Server {
public:
    kj::Promise<void> call(CallContext context) override {
        context.getResults().setNumber(context.getParams().getNumber());
        return kj::READY_NOW;
    }
    kj::Promise<void> block(BlockContext context) override {
        context.getResults().setBlock(context.getParams().getBlock());
        return kj::READY_NOW;
    }
};

uint16_t Serve() {
    std::promise<uint16_t> port;
    std::thread([&port] {
        capnp::EzRpcServer server(kj::heap<EchoServer>(), "127.0.0.1", 0);
        port.set_value(static_cast<uint16_t>(server.getPort().wait(server.getWaitScope())));
        kj::NEVER_DONE.wait(server.getWaitScope());
    }).detach();
    return port.get_future().get();
}

// A connection of this thread's loop.
class Connection {
public:
    explicit Connection(uint16_t port) : m_Client("127.0.0.1", port) {}

    kj::Promise<bool> Call(double number) {
        auto request = m_Echo.callRequest();
        request.setNumber(number);
        return request.send().then([number](auto&& reply) { return reply.getNumber() == number; });
    }
    kj::Promise<bool> Block(std::span<const char> block) {
        auto request = m_Echo.blockRequest();
        request.setBlock({reinterpret_cast<const kj::byte*>(block.data()), block.size()});
        return request.send().then(
            [size = block.size()](auto&& reply) { return reply.getBlock().size() == size; });
    }
    kj::WaitScope& GetWaitScope() { return m_Client.getWaitScope(); }

private:
    capnp::EzRpcClient m_Client;
    ::Echo::Client m_Echo = m_Client.getMain<::Echo>();
};

// False instead of an exception.
template <class Function>
bool Try(Function function) {
    bool result = false;
    kj::Maybe<kj::Exception> exception = kj::runCatchingExceptions([&] { result = function(); });
    return exception == nullptr && result;
}

class OwnLink : public Link {
public:
    explicit OwnLink(uint16_t port) : m_Connection(port) {}
    ~OwnLink() noexcept override {}
    bool Call(double number) override {
        return Try([&] { return m_Connection.Call(number).wait(m_Connection.GetWaitScope()); });
    }
    bool Block(std::span<const char> block) override {
        return Try([&] { return m_Connection.Block(block).wait(m_Connection.GetWaitScope()); });
    }

private:
    Connection m_Connection;
};

class SharedLink : public Link {
public:
    explicit SharedLink(uint16_t port) : m_Thread([this, port] { Run(port); }) {
        m_HasBegun.get_future().wait();
    }
    ~SharedLink() noexcept override {
        m_Executor->executeSync([this] { m_End->fulfill(); });
        m_Thread.join();
    }
    bool Call(double number) override {
        return Try(
            [&] { return m_Executor->executeSync([&] { return m_Connection->Call(number); }); });
    }
    bool Block(std::span<const char> block) override {
        return Try(
            [&] { return m_Executor->executeSync([&] { return m_Connection->Block(block); }); });
    }

private:
    void Run(uint16_t port) {
        Connection connection(port);
        auto end = kj::newPromiseAndFulfiller<void>();
        m_Connection = &connection;
        m_End = kj::mv(end.fulfiller);
        m_Executor = kj::getCurrentThreadExecutor().addRef();
        m_HasBegun.set_value();
        end.promise.wait(connection.GetWaitScope());
        m_End = nullptr;
    }

    // The thread's; the executor is for all.
    Connection* m_Connection = nullptr;
    kj::Own<kj::PromiseFulfiller<void>> m_End;
    kj::Own<const kj::Executor> m_Executor;

    std::promise<void> m_HasBegun;
    std::thread m_Thread;
};

std::unique_ptr<Link> Open(uint16_t port, bool isShared) {
    if (isShared) return std::make_unique<SharedLink>(port);
    return std::make_unique<OwnLink>(port);
}

}  // namespace

const Variant kCapnProto{"Cap'n Proto", Serve, Open};

}  // namespace Korvel::Bench
