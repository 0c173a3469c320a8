#include "qvm/requests/Request.hpp"

#include <stdexcept>
#include <utility>

#include "msg_svc/protobuf/ustring.hpp"

namespace qvm {
namespace {

// Objects, their control blocks and the queue's own entry.
constexpr std::size_t fixedBytes = 512;
constexpr std::size_t arrayBytes = 256;

std::size_t memoryOfTask(const cmddistributor::EvalIIP* evaluation) {
    return evaluation->getCommand().size() * sizeof(char16_t);
}

std::size_t memoryOfTask(const cmddistributor::FEvalIIP* call) {
    std::size_t bytes = call->getFunctionName().size();
    if (const auto* data = boost::get<krutil::cmddistributor::EDIDataWrapper>(&call->getInputArguments())) {
        for (const foundation::korveldata::Array& array : data->arrays()) {
            bytes += arrayBytes + array.sizeInBytes();
        }
    }
    return bytes;
}

Request::Task taskOf(const cmddistributor::IIP* iip) {
    if (const auto* const evaluation = dynamic_cast<const cmddistributor::EvalIIP*>(iip)) {
        return evaluation;
    }
    if (const auto* const call = dynamic_cast<const cmddistributor::FEvalIIP*>(iip)) {
        return call;
    }
    throw std::invalid_argument("a request: expected code to evaluate or a function to call, got another kind");
}

}  // namespace

Request arrivedRequest(framing::StreamID stream, boost::shared_ptr<const cmddistributor::IIPEnqueueMessage> message) {
    const Request::Task task = taskOf(message->getIIP().get());
    return {stream, std::move(message), task};
}

std::string fileOf(const Request& request) {
    const std::u16string& name = request.message->getDynamicName();
    const bool isPath = name.starts_with(u'/') && name.find(u'\0') == std::u16string::npos;
    return isPath ? msg_svc::protobuf::ustring_to_utf8(name) : std::string();
}

std::size_t memoryOf(const Request& request) {
    return fixedBytes + request.message->getDynamicName().size() * sizeof(char16_t) +
           request.message->getIIP()->getPluginType().size() +
           std::visit([](const auto* task) { return memoryOfTask(task); }, request.task);
}

}  // namespace qvm
