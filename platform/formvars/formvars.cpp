#include "formvars.h"

#include <stdlib.h>
#include <string.h>

namespace {

// The query as it came.
char *query_text = nullptr;
// The decoded pairs: name, zero byte, value, zero byte, and so on up to `variables_end`.
char *variables = nullptr;
char *variables_end = nullptr;

int hex_digit(char c) {
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return -1;
}

// Decodes `begin` to `end` to `out`, ends it with a zero byte and returns what follows that.
char *decode(const char *begin, const char *end, char *out) {
    for (const char *in = begin; in < end; ++in) {
        char c = *in;
        if (c == '+') {
            c = ' ';
        } else if (c == '%' && end - in > 2) {
            const int high = hex_digit(in[1]);
            const int low = hex_digit(in[2]);
            if (high >= 0 && low >= 0 && high + low > 0) {
                c = static_cast<char>(high << 4 | low);
                in += 2;
            }
        }
        *out++ = c;
    }
    *out++ = '\0';
    return out;
}

void release_variables() {
    free(variables);
    variables = nullptr;
    variables_end = nullptr;
}

}  // namespace

void CGI_set_query(const char *query) {
    free(query_text);
    query_text = query != nullptr ? strdup(query) : nullptr;
}

void CGI_save_env(void) {
    release_variables();
    if (query_text == nullptr)
        return;
    // A pair grows by one byte at most: its "&", or the end, and its "=", or the lack of one, make
    // two zero bytes. No decoding makes anything longer.
    size_t pairs = 1;
    for (const char *c = query_text; *c != '\0'; ++c)
        pairs += *c == '&';
    variables = static_cast<char *>(malloc(strlen(query_text) + 2 * pairs));
    if (variables == nullptr)
        return;

    char *out = variables;
    const char *pair = query_text;
    for (;;) {
        const char *end = strchrnul(pair, '&');
        if (end > pair) {
            const char *equals =
                static_cast<const char *>(memchr(pair, '=', static_cast<size_t>(end - pair)));
            out = decode(pair, equals != nullptr ? equals : end, out);
            out = decode(equals != nullptr ? equals + 1 : end, end, out);
        }
        if (*end == '\0')
            break;
        pair = end + 1;
    }
    variables_end = out;
}

const char *CGI_get_value(const char *name) {
    const char *at = variables;
    while (at != variables_end) {
        const char *value = at + strlen(at) + 1;
        if (strcmp(at, name) == 0)
            return value;
        at = value + strlen(value) + 1;
    }
    return nullptr;
}

void CGI_cleanup(void) {
    release_variables();
    free(query_text);
    query_text = nullptr;
}
