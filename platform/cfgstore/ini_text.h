// The text of a configuration file, taken apart in place.
#pragma once

struct IniText {
    char *next;           // the line to look at next
    const char *section;  // that the entries from here on belong to
};

struct IniEntry {
    const char *section;
    const char *key;
    const char *value;
};

// Begins to read `text`, which must stay and is written to: the texts of the entries lie in it.
IniText ini_begin(char *text);

// Takes the next entry. Returns whether there was one.
bool ini_next(IniText *ini, IniEntry *entry);
