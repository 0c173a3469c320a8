// A function to call. Immutable.
#pragma once

#include <boost/make_shared.hpp>
#include <boost/shared_ptr.hpp>
#include <boost/variant.hpp>
#include <memory>
#include <string>

#include "cmddistributor/IIP.hpp"
#include "krutil/cmddistributor/EDIDataWrapper.hpp"
#include "krutil/contextmgr/Ids.hpp"

namespace cmddistributor {

class FEvalIIP : public IIP {
  public:
    using QvmID = krutil::contextmgr::QvmID;
    using Function = boost::variant<std::string, std::shared_ptr<foundation::korveldata::Array>>;
    using Arguments = boost::variant<std::string, krutil::cmddistributor::EDIDataWrapper>;

    /// The arguments, as text or as data.
    struct Data {
        explicit Data(Arguments&& list, bool fromPeer) : arguments(std::move(list)), received(fromPeer) {}

        static boost::shared_ptr<Data> makeServerSideData(krutil::cmddistributor::EDIDataWrapper&& arrays,
                                                          const QvmID& /*client*/, const QvmID& /*server*/,
                                                          bool fromPeer) {
            return boost::make_shared<Data>(Arguments(std::move(arrays)), fromPeer);
        }

        Arguments arguments;
        bool received;
    };

    FEvalIIP(const std::string& plugin, Function function, unsigned long outputs, boost::shared_ptr<Data> data,
             IqmStreamID stream, const krutil::io::SinkTraits& out, const krutil::io::SinkTraits& err,
             const QvmID& client, const QvmID& server, bool urgent)
        : IIP(plugin, stream, out, err),
          data_(std::move(data)),
          function_(std::move(function)),
          from_(client),
          to_(server),
          outputs_(outputs),
          urgent_(urgent) {}

    const Arguments& getInputArguments() const { return data_->arguments; }
    std::string getFunctionName() const { return boost::get<std::string>(function_); }
    unsigned long getNlhs() const { return outputs_; }
    QvmID getClientQvmID() const { return from_; }
    QvmID getQvmID() const { return to_; }
    bool received() const { return data_->received; }
    bool urgent() const { return urgent_; }

  private:
    boost::shared_ptr<Data> data_;
    Function function_;
    QvmID from_, to_;
    unsigned long outputs_;
    bool urgent_;
};

}  // namespace cmddistributor
