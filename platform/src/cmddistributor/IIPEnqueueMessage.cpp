#include "cmddistributor/IIPEnqueueMessage.hpp"

namespace krutil::cmddistributor {

Impersonable::~Impersonable() = default;

}  // namespace krutil::cmddistributor

namespace cmddistributor {

IIPEnqueueMessage::IIPEnqueueMessage(boost::shared_ptr<const IIP> iip, foundation::msg_svc::exchange::IDType id,
                                     krutil::contextmgr::QcrID qcrID, boost::optional<krutil::contextmgr::QvmID> qvmID,
                                     boost::shared_ptr<foundation::msg_svc::eventmgr::EventMgr> eventMgr,
                                     krutil::cmddistributor::WhenToDequeue::WhenToDequeue dequeueMode,
                                     std::u16string name, ::capabilities::CapabilityList capabilities,
                                     std::shared_ptr<krutil::cmddistributor::Impersonable> impersonable,
                                     bool okToFlushSparingly)
    : iip_(std::move(iip)),
      id_(id),
      qcrID_(qcrID),
      qvmID_(qvmID),
      eventMgr_(std::move(eventMgr)),
      dequeueMode_(dequeueMode),
      name_(std::move(name)),
      capabilities_(capabilities),
      impersonable_(std::move(impersonable)),
      okToFlushSparingly_(okToFlushSparingly) {}

IIPEnqueueMessage::~IIPEnqueueMessage() = default;

}  // namespace cmddistributor
