#include "coredump-handler/curl_functions.h"

#include <dlfcn.h>

namespace {

constexpr char LIBRARY[] = "libcurl.so.4";

template <typename Function>
bool find(void *library, const char *name, Function *function) {
    *function = reinterpret_cast<Function>(dlsym(library, name));
    return *function != nullptr;
}

}  // namespace

bool load_curl(CurlFunctions *curl) {
    void *library = dlopen(LIBRARY, RTLD_NOW | RTLD_LOCAL);
    return library != nullptr && find(library, "curl_global_init", &curl->global_init) &&
           find(library, "curl_global_cleanup", &curl->global_cleanup) &&
           find(library, "curl_slist_append", &curl->slist_append) &&
           find(library, "curl_slist_free_all", &curl->slist_free_all) &&
           find(library, "curl_easy_init", &curl->easy_init) &&
           find(library, "curl_easy_setopt", &curl->easy_setopt) &&
           find(library, "curl_easy_perform", &curl->easy_perform) &&
           find(library, "curl_easy_cleanup", &curl->easy_cleanup);
}
