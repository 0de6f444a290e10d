// A directory for one test, with everything in it removed at the end.
#pragma once

#include <string>
#include <string_view>

class TempDir {
  public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir &) = delete;
    TempDir &operator=(const TempDir &) = delete;

    const std::string &path() const { return path_; }
    std::string operator/(std::string_view name) const { return path_ + "/" + std::string(name); }

    // Makes the file `name`, and the directories that it lies in, with these contents; returns its
    // whole path.
    std::string file(std::string_view name, std::string_view contents, unsigned mode = 0644) const;

  private:
    std::string path_;
};

// The contents of a file; fails the running test when it cannot be read.
std::string read_whole_file(const std::string &path);
