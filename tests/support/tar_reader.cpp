#include "support/tar_reader.h"

#include <gtest/gtest.h>

#include <cstdlib>

std::vector<TarMember> read_tar(const std::string &stream) {
    std::vector<TarMember> members;
    size_t at = 0;
    while (at < stream.size()) {
        TarMember member;
        member.header = stream.substr(at, 512);
        if (member.header.size() != 512) {
            ADD_FAILURE() << "a header is cut at " << member.header.size() << " bytes";
            break;
        }
        std::string blanked = member.header;
        blanked.replace(148, 8, "        ");
        unsigned long sum = 0;
        for (char c : blanked)
            sum += static_cast<unsigned char>(c);
        if (strtoul(member.header.substr(148, 8).c_str(), nullptr, 8) != sum) {
            ADD_FAILURE() << "no header at offset " << at;
            break;
        }
        member.name = member.header.substr(0, 100).c_str();
        size_t size = strtoul(member.header.substr(124, 12).c_str(), nullptr, 8);
        size_t padding = (512 - size % 512) % 512;
        at += 512;
        if (stream.size() - at < size + padding) {
            ADD_FAILURE() << member.name << " is cut: " << size << " bytes and " << padding
                          << " of padding announced, " << stream.size() - at << " left";
            break;
        }
        member.data = stream.substr(at, size);
        member.padding = stream.substr(at + size, padding);
        EXPECT_EQ(std::string(padding, '\0'), member.padding) << member.name;
        at += size + padding;
        members.push_back(member);
    }
    return members;
}

const TarMember *find_member(const std::vector<TarMember> &members, const std::string &name) {
    for (const TarMember &member : members) {
        if (member.name == name)
            return &member;
    }
    return nullptr;
}

std::vector<std::string> member_names(const std::vector<TarMember> &members, size_t skip) {
    std::vector<std::string> names;
    for (const TarMember &member : members)
        names.push_back(member.name.substr(std::min(skip, member.name.size())));
    return names;
}
