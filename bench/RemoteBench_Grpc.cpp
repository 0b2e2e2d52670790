// The column of RemoteBench.cpp for gRPC, with its blocking calls on both sides.
#include <grpcpp/grpcpp.h>

#include <string>

#include "RemoteBench.h"
#include "RemoteBench_Grpc.grpc.pb.h"

namespace Korvel::Bench {
namespace {

class EchoService final : public bench::Echo::Service {
public:
    grpc::Status PassNumber(grpc::ServerContext*, const bench::Number* request,
                            bench::Number* reply) override {
        reply->set_number(request->number());
        return grpc::Status::OK;
    }
    grpc::Status PassBlock(grpc::ServerContext*, const bench::Block* request,
                           bench::Block* reply) override {
        reply->set_block(request->block());
        return grpc::Status::OK;
    }
};

uint16_t Serve() {
    static EchoService s_Service;
    int port = 0;
    grpc::ServerBuilder builder;
    builder.AddListeningPort("127.0.0.1:0", grpc::InsecureServerCredentials(), &port);
    builder.RegisterService(&s_Service);
    static std::unique_ptr<grpc::Server> s_Server = builder.BuildAndStart();
    return s_Server ? static_cast<uint16_t>(port) : 0;
}

class GrpcLink : public Link {
public:
    explicit GrpcLink(uint16_t port) : m_Echo(bench::Echo::NewStub(Connect(port))) {}

    bool Call(double number) override {
        grpc::ClientContext context;
        bench::Number request, reply;
        request.set_number(number);
        return m_Echo->PassNumber(&context, request, &reply).ok() && reply.number() == number;
    }
    bool Block(std::span<const char> block) override {
        grpc::ClientContext context;
        bench::Block reply;
        if (m_Block.block().empty()) m_Block.set_block(block.data(), block.size());
        return m_Echo->PassBlock(&context, m_Block, &reply).ok() &&
               reply.block().size() == block.size();
    }

private:
    static std::shared_ptr<grpc::Channel> Connect(uint16_t port) {
        grpc::ChannelArguments arguments;
        // Or all channels to one address share a connection.
        arguments.SetInt(GRPC_ARG_USE_LOCAL_SUBCHANNEL_POOL, 1);
        std::string address("127.0.0.1:");
        address.append(std::to_string(port));
        return grpc::CreateCustomChannel(address, grpc::InsecureChannelCredentials(), arguments);
    }

    const std::unique_ptr<bench::Echo::Stub> m_Echo;
    bench::Block m_Block;
};

std::unique_ptr<Link> Open(uint16_t port, bool) {
    return std::make_unique<GrpcLink>(port);
}

}  // namespace

const Variant kGrpc{"gRPC", Serve, Open};

}  // namespace Korvel::Bench
