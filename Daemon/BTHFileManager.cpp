// Placeholder so the tree links; the file operations land here next.
#include "BTHFileManager.h"
