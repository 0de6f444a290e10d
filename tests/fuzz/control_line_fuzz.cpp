// The line that announces a core. The input: a byte that tells for how many process ids there is
// room, then the line.
#include "archive/control_line.h"

#include <stdint.h>
#include <stdlib.h>

#include <string>
#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    if (size < 1)
        return 0;
    // As the caller reads it: a terminated text of limited length, here in a block of its own size,
    // so that the sanitizer sees a byte too many.
    std::string text(reinterpret_cast<const char *>(data + 1), size - 1);
    text = text.substr(0, CONTROL_LINE_SIZE).c_str();
    const std::vector<char> line(text.c_str(), text.c_str() + text.size() + 1);

    (void)control_line_core_length(line.data());
    std::vector<pid_t> pids(data[0]);
    const int count = control_line_pids(line.data(), pids.data(), data[0]);
    if (count < 0 || count > data[0])
        abort();
    return 0;
}
