#include "cmddistributor/IIP.hpp"

#include "cmddistributor/EvalIIP.hpp"

namespace cmddistributor {

IIP::IIP(const std::string& pluginType, IqmStreamID streamID, const krutil::io::SinkTraits& outTraits,
         const krutil::io::SinkTraits& errTraits)
    : pluginType_(pluginType), streamID_(streamID), outTraits_(outTraits), errTraits_(errTraits) {}

IIP::~IIP() = default;

EvalIIP::EvalIIP(const std::string& pluginType, IqmStreamID streamID,
                 const boost::shared_ptr<foundation::korveldata::ICustomWorkspace>& workspace,
                 const krutil::io::SinkTraits& outTraits, const krutil::io::SinkTraits& errTraits,
                 const std::u16string& cmd, const CodeType& codeType)
    : IIP(pluginType, streamID, outTraits, errTraits), workspace_(workspace), cmd_(cmd), codeType_(codeType) {}

EvalIIP::~EvalIIP() = default;

}  // namespace cmddistributor
