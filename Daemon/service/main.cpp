// berthd: the container daemon. It has no command-line options; the device
// root comes from BERTH_ROOT (default "/").
#include "BTHDaemon.h"

int main() {
    return berth::BTHDaemonMain();
}
