// Must not compile: the source root is on no include path of the client, so
// no daemon header is reached through it either (tests/layering).
#include "Daemon/service/BTHCommandTable.h"
