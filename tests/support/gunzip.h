#pragma once

#include <string>

// What zlib's own reader makes of the gzip file `file`, which must be whole: fails the running test
// otherwise.
std::string gunzip(const std::string &file);
