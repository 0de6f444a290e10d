// Configuration files. The input is the text of one.
#include "ini_text.h"

#include <stdint.h>
#include <stdlib.h>
#include <string.h>

#include <vector>

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size) {
    // A block of its own size, so that the sanitizer sees a byte too many.
    std::vector<char> text(data, data + size);
    text.push_back('\0');
    const char *begin = text.data();
    const char *end = begin + text.size();

    IniText ini = ini_begin(text.data());
    IniEntry entry;
    size_t entries = 0;
    while (ini_next(&ini, &entry)) {
        // Each takes two bytes at least, its "=" and the end of its line.
        if (++entries > text.size() / 2 + 1 || *entry.key == '\0')
            abort();
        for (const char *part : {entry.key, entry.value})
            if (part < begin || part >= end || strchr(part, '\n') != nullptr)
                abort();
        if (strlen(entry.section) > size)
            abort();
    }
    // The end stays the end.
    if (ini_next(&ini, &entry))
        abort();
    return 0;
}
