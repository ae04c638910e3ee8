// The client sees the platform and nothing below it: this must not compile with its include path.
#include "embedded/device.h"
