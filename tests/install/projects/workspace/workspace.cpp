// One exchange of workspace variable messages, between a component that asks and one that holds a workspace. Prints
// each message and its bytes.
#include <workspace_service.pb.h>

#include <cstdio>
#include <cstdlib>
#include <string>

namespace {

void print(const google::protobuf::Message& message) {
    std::printf("%s\n    %s\n   ", message.GetDescriptor()->full_name().c_str(), message.ShortDebugString().c_str());
    for (const char byte : message.SerializeAsString()) {
        std::printf(" %02x", static_cast<unsigned char>(byte));
    }
    std::printf("\n");
}

void fill(msg_svc::protobuf::IDType& workspace) {
    workspace.set_hi(1);
    workspace.set_lo(2);
}

}  // namespace

int main() {
    workspace_service::Request request;
    request.set_number(1);
    auto& get = *request.mutable_get();
    get.add_varnames("x");
    get.add_varnames("gone");
    fill(*get.mutable_wsid());
    print(get);

    workspace_service::Answer answer;
    answer.set_number(request.number());
    for (const std::string& name : request.get().varnames()) {
        auto& entry = *answer.mutable_variables()->add_varinfo();
        entry.set_name(name);
        auto& data = *entry.mutable_replydata();
        if (name == "x") {
            data.set_status(krutil::protobuf::VARIABLE_WITH_VALUE);
            data.set_dataid(1);
        }
    }
    print(answer.variables());

    auto& one = *request.mutable_getone();
    one.set_varname("x");
    fill(*one.mutable_wsid());
    print(one);

    auto& set = *request.mutable_set();
    set.add_varnames("x");
    set.add_dataids(1);
    set.set_opcode(krutil::protobuf::VariablesSetMessage::VAR_SET);
    fill(*set.mutable_wsid());
    print(set);

    fill(*answer.mutable_gone()->mutable_wsid());
    print(answer.gone());

    // The component's own messages carry the library's, and keep states that this schema does not know yet.
    answer.mutable_variables()->mutable_varinfo(0)->mutable_replydata()->set_status(
        static_cast<krutil::protobuf::VariableStatus>(9));
    workspace_service::Answer read;
    const bool same = read.ParseFromString(answer.SerializeAsString()) &&
                      read.SerializeAsString() == answer.SerializeAsString() &&
                      read.variables().varinfo(0).replydata().status() == 9;
    return same ? EXIT_SUCCESS : EXIT_FAILURE;
}
