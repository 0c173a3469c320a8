// Errors to be shown to the user.
#pragma once

#include "TaggedSerializer.hpp"
#include "krutil.protobuf.PrintableErrorEvent.pb.h"
#include "krutil/io/PrintableErrorEvent.hpp"

namespace krutil::protobuf_serializer {

class PrintableErrorEventSerializer final
    : public TaggedSerializer<PrintableErrorEventSerializer, EventFamily, io::PrintableErrorEvent,
                              protobuf::PrintableErrorEvent> {
  public:
    static constexpr bool manyParts = true;

    PrintableErrorEventSerializer();

    /// Both directions end the process for a status outside its table, at any level of the error.
    static void fill(const io::PrintableErrorEvent& event, protobuf::PrintableErrorEvent& proto);

    /// Accepts every message: absent fields read as the default identifier, the empty error and empty text.
    static boost::shared_ptr<const foundation::msg_svc::eventmgr::BaseEvent> fromProtobuf(
        const protobuf::PrintableErrorEvent& proto);
};

}  // namespace krutil::protobuf_serializer
