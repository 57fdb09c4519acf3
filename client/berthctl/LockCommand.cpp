#include "LockCommand.h"

#include <iostream>
#include <string>

#include "ExitStatus.h"
#include "core/Value.h"
#include "core/ValueJson.h"
#include "platform/LockStateNotification.h"

namespace berth::ctl {

int runSetLockState(bool locked, bool json, std::ostream& out, std::ostream& err) {
    std::string why;
    if (!LockStateNotification::setLockState(locked ? 1 : 0, &why)) {
        err << "error: cannot write " << LockStateNotification::stateFile().string() << ": " << why
            << "\n";
        return kExitFailure;
    }
    if (json) {
        Value result = Value::dictionary();
        result.set("locked", locked);
        out << valueToJson(result) << "\n";
    } else {
        out << (locked ? "device locked" : "device unlocked") << "\n";
    }
    return kExitSuccess;
}

}  // namespace berth::ctl
