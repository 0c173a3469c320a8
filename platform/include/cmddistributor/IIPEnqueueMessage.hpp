// Hands a request to an engine's queue.
#pragma once

#include <boost/optional.hpp>
#include <boost/shared_ptr.hpp>
#include <memory>
#include <string>

#include "capabilities/CapabilityList.hpp"
#include "cmddistributor/IIP.hpp"
#include "foundation/msg_svc/eventmgr/EventMgr.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "krutil/cmddistributor/Impersonable.hpp"
#include "krutil/cmddistributor/WhenToDequeue.hpp"
#include "krutil/contextmgr/QcrID.hpp"
#include "krutil/contextmgr/QvmID.hpp"

namespace cmddistributor {

/// Begins the exchange that the request's IIPReply ends. Immutable. Getters are for lvalues: they return references
/// into the object.
class IIPEnqueueMessage : public foundation::msg_svc::exchange::Message {
  public:
    /// `eventMgr` and `impersonable` may be empty; they stay in the process.
    IIPEnqueueMessage(boost::shared_ptr<const IIP> iip, foundation::msg_svc::exchange::IDType id,
                      krutil::contextmgr::QcrID qcrID, boost::optional<krutil::contextmgr::QvmID> qvmID,
                      boost::shared_ptr<foundation::msg_svc::eventmgr::EventMgr> eventMgr,
                      krutil::cmddistributor::WhenToDequeue::WhenToDequeue dequeueMode, std::u16string name,
                      ::capabilities::CapabilityList capabilities,
                      std::shared_ptr<krutil::cmddistributor::Impersonable> impersonable, bool okToFlushSparingly);
    ~IIPEnqueueMessage() override;

    /// The request itself.
    const boost::shared_ptr<const IIP>& getIIP() const& noexcept { return iip_; }
    /// The request's identifier, which its events and its result carry.
    const foundation::msg_svc::exchange::IDType& getID() const& noexcept { return id_; }
    /// The runtime instance that is meant.
    const krutil::contextmgr::QcrID& getQcrID() const& noexcept { return qcrID_; }
    /// The engine that is meant; empty for whichever receives the message.
    const boost::optional<krutil::contextmgr::QvmID>& getQvmID() const& noexcept { return qvmID_; }
    /// Publishes the request's events in this process. May be empty, and is in a message from a peer.
    const boost::shared_ptr<foundation::msg_svc::eventmgr::EventMgr>& getEventMgr() const& noexcept {
        return eventMgr_;
    }
    /// When the queue may hand out the request.
    const krutil::cmddistributor::WhenToDequeue::WhenToDequeue& getDequeueMode() const& noexcept {
        return dequeueMode_;
    }
    /// Display name, UTF-16.
    const std::u16string& getDynamicName() const& noexcept { return name_; }
    /// Capabilities that the request needs.
    const ::capabilities::CapabilityList& getCapabilities() const& noexcept { return capabilities_; }
    /// On whose behalf the request runs. May be empty, and is in a message from a peer.
    const std::shared_ptr<krutil::cmddistributor::Impersonable>& getImpersonable() const& noexcept {
        return impersonable_;
    }
    /// Hint that the request's output need not be sent line by line.
    const bool& getOkToFlushSparingly() const& noexcept { return okToFlushSparingly_; }

  private:
    boost::shared_ptr<const IIP> iip_;
    foundation::msg_svc::exchange::IDType id_;
    krutil::contextmgr::QcrID qcrID_;
    boost::optional<krutil::contextmgr::QvmID> qvmID_;
    boost::shared_ptr<foundation::msg_svc::eventmgr::EventMgr> eventMgr_;
    krutil::cmddistributor::WhenToDequeue::WhenToDequeue dequeueMode_;
    std::u16string name_;
    ::capabilities::CapabilityList capabilities_;
    std::shared_ptr<krutil::cmddistributor::Impersonable> impersonable_;
    bool okToFlushSparingly_;
};

}  // namespace cmddistributor
