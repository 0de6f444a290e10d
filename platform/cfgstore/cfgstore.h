// Reads a configuration file: INI text, one entry at a time.
//
//   # a comment, and so is a line that begins with ";"
//   [Section]
//   Key = Value
//   Other = "Value with blanks at its end  "
#pragma once

#ifdef __cplusplus
extern "C" {
#endif

// Reads the file at `path`. Null: it cannot be opened, or is not a plain file of at most 1 MiB.
void *cfgstore_opencfg(const char *path);

// Gives the next entry, in the order of the file, and returns 1; returns 0 at the end. Blanks
// around the key and the value are left out, and so is one pair of double quotes around the value.
// Entries before any section have the empty section name. A line that is neither a section nor an
// entry is skipped. The texts belong to `cfg` and are good until it is closed.
int cfgstore_getcfg(void *cfg, const char **section, const char **key, const char **value);

// Releases `cfg`, which may be null.
void cfgstore_closecfg(void *cfg);

#ifdef __cplusplus
}
#endif
