// The message with which a web request is handed to the debug service.
#pragma once

// What the service takes at most.
constexpr int MAX_MESSAGE = 4095;

// Writes into `message` what stands for a call of the CGI program `script_name` with the
// `path_info` behind its name and the query `query`, each as the web server gives it and null where
// it gives none: the path, a zero byte, the query, a zero byte. An "nph-" at the beginning of the
// path's last component is left out: it is a word between the program and its web server, and the
// service knows an archive by that component. Returns the length, or -1 when it does not fit.
int compose_message(const char *script_name, const char *path_info, const char *query,
                    char (&message)[MAX_MESSAGE]);
