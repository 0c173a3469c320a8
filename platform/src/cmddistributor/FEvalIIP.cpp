#include "cmddistributor/FEvalIIP.hpp"

#include <stdexcept>
#include <utility>

#include "cmddistributor/FEvalResult.hpp"

namespace krutil::cmddistributor {

void DataArraysDeleter::operator()(std::vector<foundation::korveldata::Array>* arrays) const noexcept {
    delete arrays;
}

EDIDataWrapper::EDIDataWrapper(std::vector<foundation::korveldata::Array>&& arrays)
    : arrays_(new std::vector<foundation::korveldata::Array>(std::move(arrays))) {}

const std::vector<foundation::korveldata::Array>& EDIDataWrapper::arrays() const noexcept {
    static const std::vector<foundation::korveldata::Array> none;
    return arrays_ ? *arrays_ : none;
}

std::vector<foundation::korveldata::Array> EDIDataWrapper::release() noexcept {
    std::vector<foundation::korveldata::Array> arrays;
    if (arrays_) {
        arrays = std::move(*arrays_);
        arrays_.reset();
    }
    return arrays;
}

}  // namespace krutil::cmddistributor

namespace cmddistributor {

using krutil::cmddistributor::EDIDataWrapper;
using krutil::contextmgr::QvmID;

FEvalIIP::Data::Data(Arguments&& arguments, QvmID clientQvmID, QvmID serverQvmID, bool received)
    : arguments_(std::move(arguments)), clientQvmID_(clientQvmID), serverQvmID_(serverQvmID), received_(received) {}

boost::shared_ptr<FEvalIIP::Data> FEvalIIP::Data::makeServerSideData(EDIDataWrapper&& arguments,
                                                                     const QvmID& clientQvmID, const QvmID& serverQvmID,
                                                                     bool received) {
    return boost::shared_ptr<Data>(new Data(Arguments(std::move(arguments)), clientQvmID, serverQvmID, received));
}

boost::shared_ptr<FEvalIIP::Data> FEvalIIP::Data::makeClientSideData(Arguments&& arguments) {
    return boost::shared_ptr<Data>(new Data(std::move(arguments), 0, 0, false));
}

std::vector<foundation::korveldata::Array> FEvalIIP::Data::takeArrays() {
    return boost::get<EDIDataWrapper>(arguments_).release();
}

FEvalIIP::FEvalIIP(const std::string& pluginType, Function function, unsigned long nlhs, boost::shared_ptr<Data> data,
                   IqmStreamID streamID, const krutil::io::SinkTraits& outTraits,
                   const krutil::io::SinkTraits& errTraits, const QvmID& clientQvmID, const QvmID& serverQvmID,
                   bool local)
    : IIP(pluginType, streamID, outTraits, errTraits),
      function_(std::move(function)),
      nlhs_(nlhs),
      data_(std::move(data)),
      clientQvmID_(clientQvmID),
      serverQvmID_(serverQvmID),
      local_(local) {}

FEvalIIP::~FEvalIIP() = default;

const FEvalIIP::Arguments& FEvalIIP::getInputArguments() const {
    if (!data_) {
        throw std::logic_error("FEvalIIP::getInputArguments: the request was built without argument data");
    }
    return data_->arguments();
}

const std::string& FEvalIIP::getFunctionName() const {
    return boost::get<std::string>(function_);
}

FEvalResult::FEvalResult(const foundation::msg_svc::exchange::IDType& requestId,
                         std::vector<foundation::korveldata::Array>&& outputs)
    : IIPResult(requestId, boost::none), results_(std::move(outputs)) {}

FEvalResult::FEvalResult(const foundation::msg_svc::exchange::IDType& requestId, Results&& results,
                         boost::optional<RuntimeException> exception)
    : IIPResult(requestId, std::move(exception)), results_(std::move(results)) {}

FEvalResult::~FEvalResult() = default;

}  // namespace cmddistributor
