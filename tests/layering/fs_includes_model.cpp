// Must not compile: BTHMetadata.h is above the fs layer (tests/layering).
#include "BTHMetadata.h"
