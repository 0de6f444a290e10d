#include "support/slow_machine.h"

#include <stdlib.h>

namespace {

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr bool SANITIZED = true;
#else
constexpr bool SANITIZED = false;
#endif

bool is_board() {
    return getenv("FIELDKIT_LOAD_MODULES") != nullptr;
}

}  // namespace

bool is_slow_machine() {
    return SANITIZED || is_board();
}

int rounds(int many) {
    return is_board() ? many / 10 : SANITIZED ? many / 3 : many;
}
