// The families of in-process types that serializers handle: how an object is handed over, and what comes back.
#pragma once

#include <boost/shared_ptr.hpp>
#include <memory>

#include "cmddistributor/IIP.hpp"
#include "cmddistributor/IIPResult.hpp"
#include "foundation/msg_svc/eventmgr/BaseEvent.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "foundation/msg_svc/exchange/Reply.hpp"
#include "foundation/msg_svc/transport/layers/serialization/SerializerAPI.hpp"

namespace krutil::protobuf_serializer {

using foundation::msg_svc::transport::layers::serialization::Registry;
using foundation::msg_svc::transport::layers::serialization::SerializationContext;
using foundation::msg_svc::transport::layers::serialization::SerializerAPI;
using foundation::msg_svc::transport::layers::serialization::SerializerBase;

/// Objects that are shared between threads and immutable.
template <class T>
using SharedFamily = SerializerAPI<T, boost::shared_ptr<const T>, boost::shared_ptr<const T>>;

using EventFamily = SharedFamily<foundation::msg_svc::eventmgr::BaseEvent>;
using IIPFamily = SharedFamily<::cmddistributor::IIP>;
using MessageFamily = SharedFamily<foundation::msg_svc::exchange::Message>;
using ReplyFamily = SharedFamily<foundation::msg_svc::exchange::Reply>;

/// Results have one owner.
using ResultFamily = SerializerAPI<::cmddistributor::IIPResult, std::unique_ptr<::cmddistributor::IIPResult>,
                                   std::unique_ptr<::cmddistributor::IIPResult>>;

}  // namespace krutil::protobuf_serializer
