// Must not compile: BTHDaemon.h is above the model layer (tests/layering).
#include "BTHDaemon.h"
