#include "cfgstore.h"

#include <errno.h>
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include "ini_text.h"

namespace {

constexpr off_t MAX_FILE_SIZE = 1 << 20;

struct Config {
    IniText ini;
    char *text;
};

// Reads the whole of the plain file `fd`. Returns a zero-terminated text to be freed, or null.
char *read_text(int fd) {
    struct stat status;
    if (fstat(fd, &status) != 0 || !S_ISREG(status.st_mode) || status.st_size < 0 ||
        status.st_size > MAX_FILE_SIZE) {
        return nullptr;
    }
    const size_t size = static_cast<size_t>(status.st_size);
    char *text = static_cast<char *>(malloc(size + 1));
    if (text == nullptr)
        return nullptr;
    size_t length = 0;
    while (length < size) {
        const ssize_t got = read(fd, text + length, size - length);
        if (got < 0 && errno == EINTR)
            continue;
        if (got < 0) {
            free(text);
            return nullptr;
        }
        if (got == 0)
            break;  // it has become shorter meanwhile
        length += static_cast<size_t>(got);
    }
    text[length] = '\0';
    return text;
}

}  // namespace

void *cfgstore_opencfg(const char *path) {
    // A pipe that nobody writes to must not hold the caller.
    const int fd = open(path, O_RDONLY | O_CLOEXEC | O_NONBLOCK);
    if (fd < 0)
        return nullptr;
    char *text = read_text(fd);
    (void)close(fd);
    if (text == nullptr)
        return nullptr;
    Config *config = static_cast<Config *>(malloc(sizeof(Config)));
    if (config == nullptr) {
        free(text);
        return nullptr;
    }
    *config = Config{ini_begin(text), text};
    return config;
}

int cfgstore_getcfg(void *cfg, const char **section, const char **key, const char **value) {
    Config *config = static_cast<Config *>(cfg);
    IniEntry entry;
    if (!ini_next(&config->ini, &entry))
        return 0;
    *section = entry.section;
    *key = entry.key;
    *value = entry.value;
    return 1;
}

void cfgstore_closecfg(void *cfg) {
    Config *config = static_cast<Config *>(cfg);
    if (config == nullptr)
        return;
    free(config->text);
    free(config);
}
