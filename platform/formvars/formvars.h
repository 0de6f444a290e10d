// The variables of a form, as a web request carries them in its query: name=value pairs joined by
// "&", with "+" for a blank and "%" with two hexadecimal digits for any byte.
//
// One set of variables for the whole process; for one thread.
#pragma once

#ifdef __cplusplus
extern "C" {
#endif

// Takes a copy of the query text `query`; null is an empty query. The variables that were saved
// before stay until the next CGI_save_env.
void CGI_set_query(const char *query);

// Decodes the query. The first of several variables with one name counts. A name without "=" has
// the empty value. A broken escape stays as it is, and so does "%00", since a value is a C text.
void CGI_save_env(void);

// The value of the variable `name`, or null when there is none. It is good until the next
// CGI_save_env or CGI_cleanup.
const char *CGI_get_value(const char *name);

// Releases the query and the variables.
void CGI_cleanup(void);

#ifdef __cplusplus
}
#endif
