// Takes a tar stream apart, independently of the code that writes it.
#pragma once

#include <string>
#include <vector>

struct TarMember {
    std::string header;  // the 512 bytes
    std::string name;
    std::string data;
    std::string padding;
};

// The members of `stream`, which must be whole: every header's checksum right, every member's data
// and padding there, and nothing behind them. Fails the running test otherwise, and gives the
// members up to the fault.
std::vector<TarMember> read_tar(const std::string &stream);

// The member named `name`, or null.
const TarMember *find_member(const std::vector<TarMember> &members, const std::string &name);

// The names of all members, in order, without their first `skip` characters.
std::vector<std::string> member_names(const std::vector<TarMember> &members, size_t skip = 0);
