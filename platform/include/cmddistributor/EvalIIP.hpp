// A request to evaluate code text.
#pragma once

#include <boost/shared_ptr.hpp>
#include <string>

#include "cmddistributor/CodeType.hpp"
#include "cmddistributor/IIP.hpp"
#include "foundation/korveldata/ICustomWorkspace.hpp"

namespace cmddistributor {

/// Immutable, so it may be shared between threads.
class EvalIIP : public IIP {
  public:
    /// `workspace` may be empty; it stays in the process.
    EvalIIP(const std::string& pluginType, IqmStreamID streamID,
            const boost::shared_ptr<foundation::korveldata::ICustomWorkspace>& workspace,
            const krutil::io::SinkTraits& outTraits, const krutil::io::SinkTraits& errTraits, const std::u16string& cmd,
            const CodeType& codeType);
    ~EvalIIP() override;

    /// The code text, UTF-16.
    const std::u16string& getCommand() const noexcept { return cmd_; }
    /// How the code text is to be read.
    CodeType getCodeType() const noexcept { return codeType_; }
    /// The workspace to evaluate in; may be empty, and always is in a request from a peer.
    const boost::shared_ptr<foundation::korveldata::ICustomWorkspace>& getWorkspace() const noexcept {
        return workspace_;
    }

  private:
    boost::shared_ptr<foundation::korveldata::ICustomWorkspace> workspace_;
    std::u16string cmd_;
    CodeType codeType_;
};

}  // namespace cmddistributor
