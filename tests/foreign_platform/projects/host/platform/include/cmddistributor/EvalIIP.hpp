// Code to run. Immutable.
#pragma once

#include <boost/shared_ptr.hpp>
#include <string>

#include "cmddistributor/IIP.hpp"

namespace foundation::korveldata {
class ICustomWorkspace;
}  // namespace foundation::korveldata

namespace cmddistributor {

enum class CodeType : int { block, script, line, unknown };

class EvalIIP : public IIP {
  public:
    using Workspace = boost::shared_ptr<foundation::korveldata::ICustomWorkspace>;

    EvalIIP(const std::string& plugin, IqmStreamID stream, const Workspace& workspace,
            const krutil::io::SinkTraits& out, const krutil::io::SinkTraits& err, const std::u16string& code,
            const CodeType& type)
        : IIP(plugin, stream, out, err), type_(type), code_(code), workspace_(workspace) {}

    CodeType getCodeType() const { return type_; }
    std::u16string getCommand() const { return code_; }
    bool hasWorkspace() const { return workspace_ != nullptr; }

  private:
    CodeType type_;
    std::u16string code_;
    Workspace workspace_;
};

}  // namespace cmddistributor
