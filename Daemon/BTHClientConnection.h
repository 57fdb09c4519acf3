// BTHClientConnection: the caller of one request, with its identity and
// rights. One is made per request (or held by the completion of an
// asynchronous command until it has replied); the daemon's own instance,
// sharedClientConnection(), does start-up and maintenance work.
//
// The container operations of this class are added by the modules that
// implement them (BTHClientConnection+Create.cpp, ...).
#pragma once

#include <sys/types.h>

#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace berth {

inline constexpr const char* kBTHInternalClientIdentifier = "sys.kelp.berthd.internal";

class BTHClientConnection {
  public:
    // For requests: `allowGroupIdLookup` starts false.
    BTHClientConnection(std::optional<std::string> bundleId, uid_t clientUserId,
                        bool allowOtherIdLookup,
                        std::optional<std::vector<std::string>> entitledWipeIdentifiers);
    // For the daemon itself: user 0, no wipe identifiers.
    BTHClientConnection(std::optional<std::string> bundleId, bool allowOtherIdLookup);

    // The daemon's own client object ("sys.kelp.berthd.internal", may look
    // up every identifier), made once.
    static const std::shared_ptr<BTHClientConnection>& sharedClientConnection();

    // The caller's code-signing identifier; none when it could not be had.
    const std::optional<std::string>& clientBundleIdentifier() const {
        return clientBundleIdentifier_;
    }
    uid_t clientUserId() const { return clientUserId_; }
    bool allowOtherIdLookup() const { return allowOtherIdLookup_; }
    bool allowGroupIdLookup() const { return allowGroupIdLookup_; }
    void setAllowGroupIdLookup(bool allow) { allowGroupIdLookup_ = allow; }
    const std::optional<std::vector<std::string>>& entitledWipeIdentifiers() const {
        return entitledWipeIdentifiers_;
    }

    std::string description() const;

  private:
    std::optional<std::string> clientBundleIdentifier_;
    uid_t clientUserId_ = 0;
    bool allowOtherIdLookup_ = false;
    bool allowGroupIdLookup_ = false;
    std::optional<std::vector<std::string>> entitledWipeIdentifiers_;
};

}  // namespace berth
