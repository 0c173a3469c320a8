#include "qvm/requests/Request.hpp"

#include "cmddistributor/EvalIIP.hpp"
#include "cmddistributor/FEvalIIP.hpp"

namespace qvm {
namespace {

// Objects, their control blocks and the queue's own entry.
constexpr std::size_t kFixedBytes = 512;
constexpr std::size_t kArrayBytes = 256;

std::size_t memoryOfArguments(const cmddistributor::FEvalIIP& call) {
    std::size_t bytes = 0;
    if (const auto* data = boost::get<krutil::cmddistributor::EDIDataWrapper>(&call.getInputArguments())) {
        for (const foundation::korveldata::Array& array : data->arrays()) {
            bytes += kArrayBytes + array.sizeInBytes();
        }
    }
    return bytes;
}

}  // namespace

std::size_t memoryOf(const Request& request) {
    std::size_t bytes = kFixedBytes + request.message->getDynamicName().size() * sizeof(char16_t) +
                        request.message->getIIP()->getPluginType().size();
    if (const auto* eval = dynamic_cast<const cmddistributor::EvalIIP*>(request.message->getIIP().get())) {
        bytes += eval->getCommand().size() * sizeof(char16_t);
    } else if (const auto* call = dynamic_cast<const cmddistributor::FEvalIIP*>(request.message->getIIP().get())) {
        bytes += call->getFunctionName().size() + memoryOfArguments(*call);
    }
    return bytes;
}

}  // namespace qvm
