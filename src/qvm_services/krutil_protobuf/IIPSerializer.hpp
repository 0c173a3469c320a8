// The request core and the traits of its sinks.
#pragma once

#include <boost/shared_ptr.hpp>

#include "cmddistributor/IIP.hpp"
#include "krutil.protobuf.IIP.pb.h"
#include "krutil.protobuf.SinkTraits.pb.h"

namespace krutil::protobuf_serializer {

/// Copies the five traits that travel. Each fill() sets every field of a message that may hold another object's values.
void fill(const io::SinkTraits& traits, protobuf::SinkTraits& proto);
protobuf::SinkTraits toProtobuf(const io::SinkTraits& traits);

/// The trait that does not travel comes back false.
io::SinkTraits fromProtobuf(const protobuf::SinkTraits& proto);

/// Conversions of the core. It never travels alone, so this is no registered serializer: those of the concrete requests
/// embed its message.
class IIPSerializer {
  public:
    /// Both end the process for a number other than -2, -1, 0 and 1000.
    static protobuf::IqmStreamID toProtobuf(::cmddistributor::IqmStreamID streamID);
    static ::cmddistributor::IqmStreamID fromProtobuf(protobuf::IqmStreamID streamID);

    /// Ends the process for an unsupported stream number.
    static void fill(const ::cmddistributor::IIP& iip, protobuf::IIP& proto);
    static protobuf::IIP toProtobuf(const ::cmddistributor::IIP& iip);

    /// Takes any stream number as it is. Throws std::logic_error for an empty plug-in type, absent output traits and
    /// absent error traits, tested in this order.
    static boost::shared_ptr<const ::cmddistributor::IIP> fromProtobuf(const protobuf::IIP& proto);
};

}  // namespace krutil::protobuf_serializer
