#include "coredump-handler/ftp_upload.h"

#include <errno.h>
#include <stdarg.h>
#include <stdio.h>
#include <syslog.h>
#include <unistd.h>

#include "coredump-handler/curl_functions.h"

namespace {

// What is made of the configuration for one transfer.
struct UploadTexts {
    UniqueBlock<char> url{};
    UniqueBlock<char> command{};  // for the server, when the core has arrived
};

__attribute__((format(printf, 2, 3))) bool format_text(UniqueBlock<char> *text, const char *format,
                                                       ...) {
    va_list args;
    va_start(args, format);
    char *result;
    const int length = vasprintf(&result, format, args);
    va_end(args);
    if (length >= 0)
        text->reset(result);
    return length >= 0;
}

bool make_texts(const CoreConfig &config, const char *name, UploadTexts *texts) {
    if (config.target_url == nullptr)
        return false;
    // Written out: what printf makes of a null pointer is up to the C library.
    const char *path = config.target_path != nullptr ? config.target_path.get() : "(null)";
    // Kept: no RNTO follows, and the core keeps its name. The command still has a use: where the
    // server does not know the file under its whole path, the upload fails.
    return format_text(&texts->url, "%s%s/%s", config.target_url.get(), path, name) &&
           format_text(&texts->command, "RNFR %s/%s", path, name);
}

// What libcurl has been asked for, to be given back however far that came.
struct Transfer {
    explicit Transfer(const CurlFunctions &functions) : curl(functions) {}
    Transfer(const Transfer &) = delete;
    Transfer &operator=(const Transfer &) = delete;
    ~Transfer() {
        curl.slist_free_all(commands);
        if (handle != nullptr)
            curl.easy_cleanup(handle);
        if (initialised)
            curl.global_cleanup();
    }

    const CurlFunctions &curl;
    bool initialised = false;
    CURL *handle = nullptr;
    curl_slist *commands = nullptr;
};

bool begin(Transfer *transfer, const char *command) {
    const CurlFunctions &curl = transfer->curl;
    transfer->initialised = curl.global_init(CURL_GLOBAL_ALL) == CURLE_OK;
    if (!transfer->initialised)
        return false;
    transfer->handle = curl.easy_init();
    transfer->commands = curl.slist_append(nullptr, command);
    return transfer->handle != nullptr && transfer->commands != nullptr;
}

bool set_options(const Transfer &transfer, const char *url, long timeout_s) {
    const auto set = transfer.curl.easy_setopt;
    CURL *handle = transfer.handle;
    return set(handle, CURLOPT_READFUNCTION, &read_core) == CURLE_OK &&
           set(handle, CURLOPT_UPLOAD, 1L) == CURLE_OK &&
           set(handle, CURLOPT_URL, url) == CURLE_OK &&
           set(handle, CURLOPT_POSTQUOTE, transfer.commands) == CURLE_OK &&
           set(handle, CURLOPT_TIMEOUT, timeout_s) == CURLE_OK;
}

}  // namespace

bool upload_core(const CoreConfig &config, const char *name) {
    UploadTexts texts;
    CurlFunctions curl;
    if (!make_texts(config, name, &texts) || !load_curl(&curl))
        return false;
    Transfer transfer(curl);
    if (!begin(&transfer, texts.command.get()) ||
        !set_options(transfer, texts.url.get(), config.timeout_s)) {
        return false;
    }
    const CURLcode result = curl.easy_perform(transfer.handle);
    if (result == CURLE_OPERATION_TIMEDOUT)
        syslog(LOG_WARNING, "coredump truncated.");
    return result == CURLE_OK;
}

size_t read_core(char *buf, size_t size, size_t count, void *) {
    ssize_t n;
    do {
        n = read(STDIN_FILENO, buf, size * count);
    } while (n < 0 && errno == EINTR);
    return n >= 0 ? static_cast<size_t>(n) : CURL_READFUNC_ABORT;
}
