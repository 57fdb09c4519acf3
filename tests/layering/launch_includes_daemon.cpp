// berth-launch honours the daemon's relaunch blocks through the platform
// alone; the daemon's termination assertion must stay out of its reach.
#include "BTHApplicationTerminationAssertion.h"
