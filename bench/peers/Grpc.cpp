// gRPC: one unary call of a blocking stub.

#include <grpcpp/grpcpp.h>

#include <memory>
#include <stdexcept>
#include <string>

#include "Echo.grpc.pb.h"
#include "peers/RoundTripPeers.hpp"

namespace bench {
namespace {

class EchoService final : public grpc_echo::Echo::Service {
    ::grpc::Status Exchange(::grpc::ServerContext* /*context*/, const grpc_echo::Request* request,
                            grpc_echo::Answer* answer) override {
        answer->mutable_data()->resize(request->wanted());
        return ::grpc::Status::OK;
    }
};

void serve(const std::string& path, const std::function<void()>& ready) {
    EchoService service;
    ::grpc::ServerBuilder builder;
    builder.AddListeningPort("unix:" + path, ::grpc::InsecureServerCredentials());
    builder.SetMaxReceiveMessageSize(-1);
    builder.RegisterService(&service);
    const std::unique_ptr<::grpc::Server> server = builder.BuildAndStart();
    ready();
    server->Wait();
}

Contender connect(const std::string& path, std::size_t there, std::size_t back) {
    ::grpc::ChannelArguments arguments;
    arguments.SetMaxReceiveMessageSize(-1);
    const auto channel = ::grpc::CreateCustomChannel("unix:" + path, ::grpc::InsecureChannelCredentials(), arguments);
    const std::shared_ptr<grpc_echo::Echo::Stub> stub = grpc_echo::Echo::NewStub(channel);
    grpc_echo::Request request;
    request.set_data(std::string(there, 'x'));
    request.set_wanted(back);
    return {"", [stub, request, back](std::size_t count) {
                for (std::size_t i = 0; i < count; ++i) {
                    ::grpc::ClientContext context;
                    grpc_echo::Answer answer;
                    const ::grpc::Status status = stub->Exchange(&context, request, &answer);
                    if (!status.ok() || answer.data().size() != back) {
                        throw std::runtime_error("gRPC: expected an answer of another size; " + status.error_message());
                    }
                }
            }};
}

}  // namespace

RoundTripPeer grpc() {
    return {"gRPC", serve, connect};
}

}  // namespace bench
