// A plug-in that uses the library: its protocol and its messages.
#include <krutil.protobuf.TextBaseEvent.pb.h>
#include <KrutilProtocol.hpp>

// Writes a message and reads it back; returns the size of its bytes, 0 when it came back as something else.
extern "C" int useTheLibrary() {
    krutil::protobuf::KrutilProtocol::init();
    krutil::protobuf::TextBaseEvent written;
    written.set_text("twelve");
    krutil::protobuf::TextBaseEvent read;
    return read.ParseFromString(written.SerializeAsString()) && read.text() == "twelve"
               ? static_cast<int>(written.ByteSizeLong())
               : 0;
}
