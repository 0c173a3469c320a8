// The common core of every request: where its text goes and which plug-in runs it.
#pragma once

#include <string>

#include "cmddistributor/IqmStreamID.hpp"
#include "krutil/io/SinkTraits.hpp"

namespace cmddistributor {

/// Interactive input request. Immutable, so it may be shared between threads.
class IIP {
  public:
    /// `pluginType` names the plug-in that runs the request; `outTraits` and `errTraits` are those of the places that
    /// show its output and its errors.
    IIP(const std::string& pluginType, IqmStreamID streamID, const krutil::io::SinkTraits& outTraits,
        const krutil::io::SinkTraits& errTraits);
    virtual ~IIP();

    /// The streams that the request writes to.
    IqmStreamID getStreamID() const noexcept { return streamID_; }
    /// Name of the plug-in that runs the request; peers refuse an empty one.
    const std::string& getPluginType() const noexcept { return pluginType_; }
    /// Traits of what shows the request's output.
    const krutil::io::SinkTraits& getOutTraits() const noexcept { return outTraits_; }
    /// Traits of what shows the request's errors.
    const krutil::io::SinkTraits& getErrTraits() const noexcept { return errTraits_; }

  private:
    std::string pluginType_;
    IqmStreamID streamID_;
    krutil::io::SinkTraits outTraits_;
    krutil::io::SinkTraits errTraits_;
};

}  // namespace cmddistributor
