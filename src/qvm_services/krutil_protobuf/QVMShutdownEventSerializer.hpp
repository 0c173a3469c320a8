// The engine's notice that it shuts down.
#pragma once

#include "TaggedSerializer.hpp"
#include "krutil.protobuf.QVMShutdownEvent.pb.h"
#include "krutil/eventmgr/QVMShutdownEvent.hpp"

namespace krutil::protobuf_serializer {

/// The event has no content, so serialize takes any pointer, null included, and deserialize any bytes.
class QVMShutdownEventSerializer final
    : public TaggedSerializer<QVMShutdownEventSerializer, EventFamily, eventmgr::QVMShutdownEvent,
                              protobuf::QVMShutdownEvent> {
  public:
    QVMShutdownEventSerializer();

    /// Says that there is nothing to fill, and is never called.
    static void fill();

    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::QVMShutdownEvent& proto);
};

}  // namespace krutil::protobuf_serializer
