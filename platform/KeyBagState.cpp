#include "platform/KeyBagState.h"

#include "platform/LockStateNotification.h"

namespace berth::keybag {

bool deviceIsLocked() {
    return LockStateNotification::lockState() == 1;
}

}  // namespace berth::keybag
