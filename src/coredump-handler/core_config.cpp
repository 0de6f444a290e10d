#include "coredump-handler/core_config.h"

#include <cfgstore.h>
#include <errno.h>
#include <limits.h>
#include <stdlib.h>
#include <string.h>

#include <algorithm>
#include <memory>
#include <string_view>

namespace {

constexpr char CHOICE_KEY[] = "CoreHandler";
constexpr std::string_view FTP_CHOICE = "FTP";
// Kept: names that only begin like these count as well, sections and keys alike (TargetURL2 is a
// TargetURL). Configurations that have always worked may hold such names.
constexpr std::string_view FTP_SECTION = "CoreHandlerFtp";
constexpr std::string_view URL_KEY = "TargetURL";
constexpr std::string_view PATH_KEY = "TargetPath";
constexpr std::string_view TIMEOUT_KEY = "Timeout";

constexpr long MAX_TIMEOUT_S = INT_MAX / 1000;  // libcurl counts milliseconds in an int

struct CloseConfig {
    void operator()(void *cfg) const { cfgstore_closecfg(cfg); }
};

// An entry's texts need not outlive the next one.
struct Entry {
    const char *section;
    const char *key;
    const char *value;
};

bool next_entry(void *cfg, Entry *entry) {
    return cfgstore_getcfg(cfg, &entry->section, &entry->key, &entry->value) != 0;
}

bool begins_with(const char *text, std::string_view prefix) {
    return strncmp(text, prefix.data(), prefix.size()) == 0;
}

bool find_choice(void *cfg, Entry *entry) {
    while (next_entry(cfg, entry)) {
        if (strcmp(entry->key, CHOICE_KEY) == 0)
            return true;
    }
    return false;
}

// Returns whether there was memory for it.
bool replace(UniqueBlock<char> *text, const char *value) {
    text->reset(strdup(value));
    return *text != nullptr;
}

// The last entry of a key counts.
bool take_entry(const Entry &entry, CoreConfig *config) {
    if (!begins_with(entry.section, FTP_SECTION))
        return true;
    if (begins_with(entry.key, URL_KEY))
        return replace(&config->target_url, entry.value);
    if (begins_with(entry.key, PATH_KEY))
        return replace(&config->target_path, entry.value);
    if (begins_with(entry.key, TIMEOUT_KEY))
        config->timeout_s = parse_timeout(entry.value);
    return true;
}

}  // namespace

int read_core_config(const char *path, CoreConfig *config) {
    const std::unique_ptr<void, CloseConfig> cfg(cfgstore_opencfg(path));
    if (cfg == nullptr)
        return 0;
    Entry entry;
    if (!find_choice(cfg.get(), &entry) || !begins_with(entry.value, FTP_CHOICE))
        return 0;
    config->use_ftp = true;
    // What stands before the choice is not seen again: the section has to come after it.
    while (next_entry(cfg.get(), &entry)) {
        if (!take_entry(entry, config))
            return -ENOMEM;
    }
    return 0;
}

long parse_timeout(const char *text) {
    return std::clamp(strtol(text, nullptr, 10), 0L, MAX_TIMEOUT_S);
}
