// Where the bytes are that a peer has lent.
#pragma once

#include "foundation/msg_svc/transport/layers/session/lending/SharedContent.hpp"
#include "foundation/vantor/carrier/framing/Frame.hpp"

namespace foundation::msg_svc::transport::layers::session::lending {

namespace framing = ::foundation::vantor::carrier::framing;

/// Gives whoever puts messages together the contents that do not travel on the stream.
class LentContents {
  public:
    /// The content as a buffer of a data frame; each one is asked for once, in the order of the frames. Throws
    /// MemoryRefused for what is not as it has to be, and std::bad_alloc.
    virtual framing::FrameBuffer borrow(const SharedContent& content) = 0;

  protected:
    ~LentContents() = default;
};

}  // namespace foundation::msg_svc::transport::layers::session::lending
