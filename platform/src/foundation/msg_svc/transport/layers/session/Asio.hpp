// Asio, as the thread sanitizer can follow it. To be included before anything of Asio.
#pragma once

// GCC's thread sanitizer knows no fences. The ones around Asio's handlers only repeat what its queue's mutex gives.
#ifdef __SANITIZE_THREAD__
#define BOOST_ASIO_DISABLE_FENCED_BLOCK
#endif

#include <boost/asio/buffer.hpp>
#include <boost/asio/executor_work_guard.hpp>
#include <boost/asio/io_context.hpp>
#include <boost/asio/posix/stream_descriptor.hpp>
#include <boost/asio/post.hpp>
#include <boost/asio/steady_timer.hpp>

namespace foundation::msg_svc::transport::layers::session {

namespace asio = boost::asio;
using ErrorCode = boost::system::error_code;

}  // namespace foundation::msg_svc::transport::layers::session
