// Function calls of a client, for tests of what an engine does with them.
#pragma once

#include <boost/smart_ptr/make_shared.hpp>
#include <boost/variant/get.hpp>
#include <string>
#include <typeinfo>
#include <utility>
#include <vector>

#include "apps/qvm/fixture/EngineFixture.hpp"
#include "cmddistributor/FEvalIIP.hpp"
#include "cmddistributor/FEvalResult.hpp"
#include "foundation/korveldata/ArrayFactory.hpp"
#include "support/CountingBytes.hpp"

namespace qvm_test {

using foundation::korveldata::Array;
using foundation::korveldata::ArrayFactory;
using foundation::korveldata::ElementType;
using foundation::korveldata::MemoryOrder;

inline Array text(std::u16string_view units) {
    return ArrayFactory().createText(units);
}

inline boost::shared_ptr<const cmddistributor::IIP> callOf(const std::string& function, std::vector<Array> arguments,
                                                           unsigned long wanted = 1) {
    using cmddistributor::FEvalIIP;
    return boost::make_shared<const FEvalIIP>(
        "python", FEvalIIP::Function(function), wanted,
        FEvalIIP::Data::makeClientSideData(krutil::cmddistributor::EDIDataWrapper(std::move(arguments))),
        cmddistributor::IqmStreamID::ekIqmCmdWinStream, krutil::io::SinkTraits(), krutil::io::SinkTraits(), 1, 2, true);
}

/// The outputs of a call that succeeded; a call that failed fails the test.
inline std::vector<Array> outputsOf(const Evaluation& call) {
    const auto* const result = dynamic_cast<const cmddistributor::FEvalResult*>(call.reply->getResult().get());
    if (result == nullptr) {
        ADD_FAILURE() << "no outputs, but: " << call.errorId() << ": " << call.errorText();
        return {};
    }
    return boost::get<std::vector<Array>>(result->getResults());
}

inline std::vector<Array> call(EngineClient& client, const std::string& function, std::vector<Array> arguments,
                               unsigned long wanted = 1) {
    return outputsOf(client.await(client.enqueue(callOf(function, std::move(arguments), wanted))));
}

/// "Type: text" of a call that failed; its result must be a plain one.
inline std::string callError(EngineClient& client, const std::string& function, std::vector<Array> arguments,
                             unsigned long wanted = 1) {
    const Evaluation failed = client.await(client.enqueue(callOf(function, std::move(arguments), wanted)));
    const cmddistributor::IIPResult& result = *failed.reply->getResult();
    EXPECT_EQ(typeid(result), typeid(cmddistributor::IIPResult));
    return failed.errorId() + ": " + failed.errorText();
}

/// Elements 0, 1, 2, ... as unsigned bytes.
inline Array bytes(std::uint64_t count) {
    Array array = ArrayFactory().createArray(ElementType::UInt8, {count});
    test_support::countUp(array.mutableData(), count, 251);
    return array;
}

}  // namespace qvm_test
