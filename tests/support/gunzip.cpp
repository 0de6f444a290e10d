#include "support/gunzip.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include "support/temp_dir.h"

std::string gunzip(const std::string &file) {
    TempDir dir;
    gzFile in = gzopen(dir.file("a.gz", file).c_str(), "rb");
    std::string text;
    char block[65536];
    int n;
    while ((n = gzread(in, block, sizeof block)) > 0)
        text.append(block, static_cast<size_t>(n));
    EXPECT_EQ(0, n) << "not a whole gzip file";
    EXPECT_EQ(Z_OK, gzclose(in));
    return text;
}
