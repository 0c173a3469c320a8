// What all requests have. Immutable.
#pragma once

#include <string>

#include "krutil/io/SinkTraits.hpp"

namespace cmddistributor {

enum IqmStreamID : int { nowhere = -2, everywhere = -1, window = 0, machine = 1000 };

class IIP {
  public:
    IIP(const std::string& plugin, IqmStreamID stream, const krutil::io::SinkTraits& out,
        const krutil::io::SinkTraits& err)
        : stream_(stream), err_(err), out_(out), plugin_(plugin) {}
    virtual ~IIP() = default;

    IqmStreamID getStreamID() const { return stream_; }
    std::string getPluginType() const { return plugin_; }
    const krutil::io::SinkTraits& getOutTraits() const { return out_; }
    const krutil::io::SinkTraits& getErrTraits() const { return err_; }

  private:
    IqmStreamID stream_;
    krutil::io::SinkTraits err_, out_;
    std::string plugin_;
};

}  // namespace cmddistributor
