// The libraries that only some applets need, opened when the first of their functions is called. So
// an applet starts in the time of the C library alone, and a tracer also where the device's own
// libraries are broken.
//
// They are where the dynamic linker looks for libraries, or where they were installed beside the
// executable. The latter is no run path: that would be searched for the C library, too, and for
// that first, at every start.
//
// The functions in here stand in front of those of the same names: the linker finds these first,
// and no call in the program knows the difference.
#include <cfgstore.h>
#include <dlfcn.h>
#include <formvars.h>
#include <sockhand.h>
#include <stdio.h>
#include <syslog.h>
#include <unistd.h>
#include <zlib.h>

namespace {

struct Library {
    const char *name;
    const char *beside;  // the same, as the executable's neighbour
    void *handle;
};

// The dynamic linker itself puts the executable's folder for $ORIGIN.
#define LIBRARY(name) \
    { name, "$ORIGIN/../" LIBRARY_FOLDER "/" name, nullptr }
Library sockhand = LIBRARY("libsockhand.so");
Library formvars = LIBRARY("libformvars.so");
Library cfgstore = LIBRARY("libcfgstore.so");
Library zlib = LIBRARY("libz.so.1");
#undef LIBRARY

constexpr int CANNOT_LOAD = 127;  // the status of a program that the dynamic linker gives up on

[[noreturn]] void give_up() {
    const char *reason = dlerror();
    fprintf(stderr, "fieldkit: %s\n", reason);
    syslog(LOG_ERR, "%s", reason);
    _exit(CANNOT_LOAD);
}

void *open_library(const Library &library) {
    void *handle = dlopen(library.name, RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr)
        handle = dlopen(library.beside, RTLD_NOW | RTLD_LOCAL);
    // Once more where both failed: what is told is the reason that the first one had.
    return handle != nullptr ? handle : dlopen(library.name, RTLD_NOW | RTLD_LOCAL);
}

// The library's own function `name`. Threads may come here at once: they find the same.
template <typename Function>
Function *find(Library *library, const char *name) {
    if (library->handle == nullptr)
        library->handle = open_library(*library);
    void *function = library->handle != nullptr ? dlsym(library->handle, name) : nullptr;
    if (function == nullptr)
        give_up();
    return reinterpret_cast<Function *>(function);
}

}  // namespace

// NOLINTBEGIN(bugprone-macro-parentheses): a declaration has no room for them
#define FORWARD(library, result, name, parameters, arguments)                 \
    extern "C" __attribute__((visibility("hidden"))) result name parameters { \
        static decltype(::name) *function;                                    \
        if (function == nullptr)                                              \
            function = find<decltype(::name)>(&library, #name);               \
        return function arguments;                                            \
    }
// NOLINTEND(bugprone-macro-parentheses)

FORWARD(sockhand, int, sockhand_server_socket, (const char *path, int mode), (path, mode))
FORWARD(sockhand, int, sockhand_recv, (int sock, void *buf, int max, int *fd), (sock, buf, max, fd))

FORWARD(formvars, void, CGI_set_query, (const char *query), (query))
FORWARD(formvars, void, CGI_save_env, (void), ())
FORWARD(formvars, const char *, CGI_get_value, (const char *name), (name))
FORWARD(formvars, void, CGI_cleanup, (void), ())

FORWARD(cfgstore, void *, cfgstore_opencfg, (const char *path), (path))
FORWARD(cfgstore, int, cfgstore_getcfg,
        (void *cfg, const char **section, const char **key, const char **value),
        (cfg, section, key, value))
FORWARD(cfgstore, void, cfgstore_closecfg, (void *cfg), (cfg))

FORWARD(zlib, int, deflateInit2_,
        (z_stream * stream, int level, int method, int window_bits, int memory_level, int strategy,
         const char *version, int stream_size),
        (stream, level, method, window_bits, memory_level, strategy, version, stream_size))
FORWARD(zlib, int, deflate, (z_stream * stream, int flush), (stream, flush))
FORWARD(zlib, int, deflateEnd, (z_stream * stream), (stream))
FORWARD(zlib, uLong, crc32, (uLong crc, const Bytef *buf, uInt length), (crc, buf, length))
