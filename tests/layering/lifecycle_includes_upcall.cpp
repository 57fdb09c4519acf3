// Must not compile: BTHUpcallServer.h is above the lifecycle layer (tests/layering).
#include "BTHUpcallServer.h"
