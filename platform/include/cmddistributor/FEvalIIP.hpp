// A request to call a function with arrays.
#pragma once

#include <boost/shared_ptr.hpp>
#include <boost/variant.hpp>
#include <memory>
#include <string>
#include <vector>

#include "cmddistributor/IIP.hpp"
#include "foundation/korveldata/Array.hpp"
#include "krutil/cmddistributor/EDIDataWrapper.hpp"
#include "krutil/contextmgr/QvmID.hpp"

namespace cmddistributor {

/// Immutable but for its argument data, which whoever runs the request may take out once.
class FEvalIIP : public IIP {
  public:
    /// The function by name, or as an array that holds it.
    using Function = boost::variant<std::string, std::shared_ptr<foundation::korveldata::Array>>;

    /// Arguments as source text, to be evaluated where the request runs, or as data. Only data can be sent.
    using Arguments = boost::variant<std::vector<std::u16string>, krutil::cmddistributor::EDIDataWrapper>;

    /// The arguments, apart from the request because they are consumed when it runs. Not synchronised.
    class Data {
      public:
        /// As the side holds them that runs the request. `received` says that they came from a peer, so that no one
        /// else in this process shares their memory.
        static boost::shared_ptr<Data> makeServerSideData(krutil::cmddistributor::EDIDataWrapper&& arguments,
                                                          const krutil::contextmgr::QvmID& clientQvmID,
                                                          const krutil::contextmgr::QvmID& serverQvmID, bool received);

        /// As the side holds them that asks.
        static boost::shared_ptr<Data> makeClientSideData(Arguments&& arguments);

        /// Valid until takeArrays() or destruction.
        const Arguments& arguments() const noexcept { return arguments_; }
        /// Whether the arguments came from a peer.
        bool received() const noexcept { return received_; }
        /// Engine that asks; 0 on the side that asks.
        krutil::contextmgr::QvmID clientQvmID() const noexcept { return clientQvmID_; }
        /// Engine that runs the call; 0 on the side that asks.
        krutil::contextmgr::QvmID serverQvmID() const noexcept { return serverQvmID_; }

        /// Moves the data form out and leaves no arguments. Throws boost::bad_get for the other form.
        std::vector<foundation::korveldata::Array> takeArrays();

      private:
        Data(Arguments&& arguments, krutil::contextmgr::QvmID clientQvmID, krutil::contextmgr::QvmID serverQvmID,
             bool received);

        Arguments arguments_;
        krutil::contextmgr::QvmID clientQvmID_;
        krutil::contextmgr::QvmID serverQvmID_;
        bool received_;
    };

    /// `nlhs` is the number of outputs that are wanted. Identifiers of 0 are "not set"; peers refuse them. `local` says
    /// that the request was made in this process.
    FEvalIIP(const std::string& pluginType, Function function, unsigned long nlhs, boost::shared_ptr<Data> data,
             IqmStreamID streamID, const krutil::io::SinkTraits& outTraits, const krutil::io::SinkTraits& errTraits,
             const krutil::contextmgr::QvmID& clientQvmID, const krutil::contextmgr::QvmID& serverQvmID, bool local);
    ~FEvalIIP() override;

    /// Throws std::logic_error when the request was built without data.
    const Arguments& getInputArguments() const;

    /// The function's name, UTF-8. Throws boost::bad_get for a function that was given as an array.
    const std::string& getFunctionName() const;

    /// Number of outputs that are wanted.
    unsigned long getNlhs() const noexcept { return nlhs_; }
    /// Engine that asks.
    krutil::contextmgr::QvmID getClientQvmID() const noexcept { return clientQvmID_; }
    /// Engine that is to run the call.
    krutil::contextmgr::QvmID getQvmID() const noexcept { return serverQvmID_; }
    /// May be empty.
    const boost::shared_ptr<Data>& getData() const noexcept { return data_; }
    /// Whether the request was made in this process.
    bool isLocal() const noexcept { return local_; }

  private:
    Function function_;
    unsigned long nlhs_;
    boost::shared_ptr<Data> data_;
    krutil::contextmgr::QvmID clientQvmID_;
    krutil::contextmgr::QvmID serverQvmID_;
    bool local_;
};

}  // namespace cmddistributor
