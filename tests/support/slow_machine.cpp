#include "support/slow_machine.h"

#include <stdlib.h>

bool is_slow_machine() {
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
    return true;
#else
    return getenv("FIELDKIT_LOAD_MODULES") != nullptr;
#endif
}

int rounds(int many) {
    return is_slow_machine() ? many / 3 : many;
}
