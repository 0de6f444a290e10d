// The functions of libcurl, looked up when they are needed: the library and the many that it brings
// along cost time and memory, which no other applet shall pay.
#pragma once

#include <curl/curl.h>

struct CurlFunctions {
    decltype(&curl_global_init) global_init;
    decltype(&curl_global_cleanup) global_cleanup;
    decltype(&curl_slist_append) slist_append;
    decltype(&curl_slist_free_all) slist_free_all;
    decltype(&curl_easy_init) easy_init;
    decltype(&curl_easy_setopt) easy_setopt;
    decltype(&curl_easy_perform) easy_perform;
    decltype(&curl_easy_cleanup) easy_cleanup;
};

// Loads libcurl, for the rest of the process. Returns whether it is there and has them all.
bool load_curl(CurlFunctions *curl);
