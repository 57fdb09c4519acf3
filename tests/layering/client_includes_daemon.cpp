// Must not compile: the client sees no daemon header (tests/layering).
#include "BTHCommandTable.h"
