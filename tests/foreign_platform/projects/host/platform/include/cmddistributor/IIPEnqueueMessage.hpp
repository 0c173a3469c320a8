// A request on its way to a queue. Immutable.
#pragma once

#include <boost/optional.hpp>
#include <boost/shared_ptr.hpp>
#include <memory>
#include <string>

#include "capabilities/CapabilityList.hpp"
#include "cmddistributor/IIP.hpp"
#include "foundation/msg_svc/exchange/IDType.hpp"
#include "foundation/msg_svc/exchange/Message.hpp"
#include "krutil/contextmgr/Ids.hpp"

namespace foundation::msg_svc::eventmgr {
class EventMgr;
}  // namespace foundation::msg_svc::eventmgr

namespace krutil::cmddistributor {
class Impersonable;
namespace WhenToDequeue {
enum WhenToDequeue : int { some, soon, pause, prompt, plainPrompt, debugPrompt, idle, first };
}  // namespace WhenToDequeue
}  // namespace krutil::cmddistributor

namespace cmddistributor {

class IIPEnqueueMessage : public foundation::msg_svc::exchange::Message {
  public:
    using When = krutil::cmddistributor::WhenToDequeue::WhenToDequeue;

    IIPEnqueueMessage(boost::shared_ptr<const IIP> request, foundation::msg_svc::exchange::IDType id,
                      krutil::contextmgr::QcrID runtime, boost::optional<krutil::contextmgr::QvmID> engine,
                      boost::shared_ptr<foundation::msg_svc::eventmgr::EventMgr> events, When when, std::u16string name,
                      ::capabilities::CapabilityList needs, std::shared_ptr<krutil::cmddistributor::Impersonable> actor,
                      bool sparing)
        : request_(std::move(request)),
          id_(id),
          runtime_(runtime),
          engine_(engine),
          when_(when),
          name_(std::move(name)),
          needs_(needs),
          sparing_(sparing),
          bound_(events != nullptr || actor != nullptr) {}

    boost::shared_ptr<const IIP> getIIP() const& { return request_; }
    foundation::msg_svc::exchange::IDType getID() const& { return id_; }
    krutil::contextmgr::QcrID getQcrID() const& { return runtime_; }
    boost::optional<krutil::contextmgr::QvmID> getQvmID() const& { return engine_; }
    When getDequeueMode() const& { return when_; }
    std::u16string getDynamicName() const& { return name_; }
    ::capabilities::CapabilityList getCapabilities() const& { return needs_; }
    bool getOkToFlushSparingly() const& { return sparing_; }
    /// Whether it holds on to an object of this process.
    bool bound() const { return bound_; }

  private:
    boost::shared_ptr<const IIP> request_;
    foundation::msg_svc::exchange::IDType id_;
    krutil::contextmgr::QcrID runtime_;
    boost::optional<krutil::contextmgr::QvmID> engine_;
    When when_;
    std::u16string name_;
    ::capabilities::CapabilityList needs_;
    bool sparing_;
    bool bound_;
};

}  // namespace cmddistributor
