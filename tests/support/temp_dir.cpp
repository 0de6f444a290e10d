#include "support/temp_dir.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <sstream>

TempDir::TempDir() {
    const char *base = getenv("TMPDIR");
    path_ = std::string(base != nullptr ? base : "/tmp") + "/fieldkit-test-XXXXXX";
    if (mkdtemp(path_.data()) == nullptr)
        abort();
}

TempDir::~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

std::string TempDir::file(std::string_view name, std::string_view contents, unsigned mode) const {
    std::filesystem::path path = *this / name;
    std::filesystem::create_directories(path.parent_path());
    std::ofstream(path, std::ios::binary) << contents;
    EXPECT_EQ(0, chmod(path.c_str(), mode));
    return path;
}

std::string read_whole_file(const std::string &path) {
    std::ifstream file(path, std::ios::binary);
    EXPECT_TRUE(file.is_open()) << path;
    std::ostringstream contents;
    contents << file.rdbuf();
    return contents.str();
}
