#include "request_message.h"

#include <stddef.h>
#include <string.h>

namespace {

// The last component of `path`, which has `length` bytes.
char *last_component(char *path, size_t length) {
    char *start = path + length;
    while (start > path && start[-1] != '/')
        --start;
    return start;
}

}  // namespace

int compose_message(const char *script_name, const char *path_info, const char *query,
                    char (&message)[MAX_MESSAGE]) {
    constexpr char NPH[] = "nph-";
    constexpr size_t NPH_LENGTH = sizeof(NPH) - 1;
    const size_t name_length = script_name != nullptr ? strlen(script_name) : 0;
    const size_t info_length = path_info != nullptr ? strlen(path_info) : 0;
    const size_t query_length = query != nullptr ? strlen(query) : 0;
    size_t path_length = name_length + info_length;
    // Each of the three lies in this process's memory, so their sum does not overflow.
    if (path_length + 1 + query_length + 1 > MAX_MESSAGE)
        return -1;

    if (name_length > 0)
        memcpy(message, script_name, name_length);
    if (info_length > 0)
        memcpy(message + name_length, path_info, info_length);
    message[path_length] = '\0';
    char *component = last_component(message, path_length);
    if (strncmp(component, NPH, NPH_LENGTH) == 0) {
        memmove(component, component + NPH_LENGTH, strlen(component + NPH_LENGTH) + 1);
        path_length -= NPH_LENGTH;
    }

    char *place = message + path_length + 1;
    if (query_length > 0)
        memcpy(place, query, query_length);
    place[query_length] = '\0';
    return static_cast<int>(path_length + 1 + query_length + 1);
}
