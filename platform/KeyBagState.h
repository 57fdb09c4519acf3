// The key bag's lock state as the file services need it: one question, is
// the device locked now. The state is the number in <root>/run/berthd/lockstate
// (1 locked; 0, an absent file or anything else unlocked). Watching for
// changes is the lock-state notification's business, not this query's.
#pragma once

namespace berth::keybag {

bool deviceIsLocked();

}  // namespace berth::keybag
