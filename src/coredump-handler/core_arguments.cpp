#include "coredump-handler/core_arguments.h"

#include <assert.h>
#include <errno.h>
#include <stdlib.h>
#include <string.h>
#include <syslog.h>
#include <unistd.h>

#include <algorithm>

#include "util/unique_fd.h"

namespace {

// Where in the vector each of them is.
enum { NAME = 1, SIZE_LIMIT, EXECUTABLE_PATH, EXECUTABLE_NAME, ARGUMENT_COUNT };

constexpr char DEFAULT_NAME[] = "core.core";

// What is wrong with the arguments, or null. The first fault in this order is the one to be told.
const char *find_fault(int argc, char **argv, uint64_t *limit) {
    if (argc < ARGUMENT_COUNT)
        return "wrong number of arguments";
    if (*argv[EXECUTABLE_NAME] == '\0')
        return "executable name argument missing";
    if (*argv[EXECUTABLE_PATH] == '\0')
        return "executable path argument missing";
    if (*argv[SIZE_LIMIT] == '\0')
        return "core file size argument missing";
    if (!parse_size_limit(argv[SIZE_LIMIT], limit))
        return "core file size limit parsing error";
    return nullptr;
}

void log_disabled(char **argv) {
    // The kernel writes "!" for "/".
    UniqueBlock<char> path(strdup(argv[EXECUTABLE_PATH]));
    if (path != nullptr)
        std::replace(path.get(), path.get() + strlen(path.get()), '!', '/');
    syslog(LOG_INFO, "core dumps disabled for '%s/%s'",
           path != nullptr ? path.get() : argv[EXECUTABLE_PATH], argv[EXECUTABLE_NAME]);
}

}  // namespace

bool check_core_arguments(int argc, char **argv, int *status) {
    // One or none: somebody delivers a core by hand.
    if (argc <= SIZE_LIMIT)
        return true;
    uint64_t limit;
    const char *fault = find_fault(argc, argv, &limit);
    if (fault != nullptr) {
        syslog(LOG_ERR, "%s", fault);
        *status = 1;
        return false;
    }
    const long pagesize = sysconf(_SC_PAGESIZE);
    assert(pagesize > 0);
    // The kernel leaves the limit to those that it pipes cores to: a limit of 0 comes here, too.
    if (limit < static_cast<uint64_t>(pagesize)) {
        log_disabled(argv);
        *status = 0;
        return false;
    }
    return true;
}

bool parse_size_limit(const char *text, uint64_t *limit) {
    char *end;
    errno = 0;
    *limit = strtoull(text, &end, 10);
    return errno == 0 && end != text && *end == '\0';
}

const char *core_name(int argc, char **argv) {
    return argc > NAME ? argv[NAME] : DEFAULT_NAME;
}
