#include "BTHRelayRequest.h"

#include "BTHLog.h"
#include "BTHRequest.h"
#include "BTHRequestIntake.h"

namespace berth {

namespace {

// Takes the relay's copy apart rather than copying the entitlements again.
BTHPeerIdentity toPeerIdentity(RelayPeerIdentity relay) {
    BTHPeerIdentity peer;
    peer.pid = relay.pid;
    peer.effectiveUserId = relay.effectiveUserId;
    peer.processStillBound = relay.processStillBound;
    peer.signingIdentifier = std::move(relay.signingIdentifier);
    peer.signingError = std::move(relay.signingError);
    peer.entitlements = std::move(relay.entitlements);
    return peer;
}

// A request of the message service, with its reply. The identity is taken
// when the request is processed, so a peer that exec'd or exited since it
// connected is seen as it is now.
class RelayRequest final : public BTHRequest {
  public:
    RelayRequest(const RelayEvent& event, RelayReply reply)
        : message_(event.sharedMessage()),
          reply_(std::move(reply)),
          peer_(toPeerIdentity(event.connection()->peerIdentity())) {}

    const Value& message() const override { return *message_; }
    Value& reply() override { return reply_.body(); }
    const BTHPeerIdentity& peer() const override { return peer_; }
    void sendReply() override {
        if (!reply_.sent()) reply_.send();
    }

  private:
    std::shared_ptr<const Value> message_;  // shared with the event
    RelayReply reply_;
    BTHPeerIdentity peer_;
};

}  // namespace

void BTHProcessRelayEvent(const RelayEvent& event) {
    BTH_FUNCTION("BTHProcessRelayEvent");
    if (event.isConnectionInvalid()) return;
    std::optional<RelayReply> reply = event.makeReply();
    if (!reply) {
        BTHLogError("Dictionary does not have reply context");
        event.connection()->cancel();
        return;
    }
    BTHProcessRequest(std::make_shared<RelayRequest>(event, std::move(*reply)));
}

}  // namespace berth
