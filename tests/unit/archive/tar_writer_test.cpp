#include "archive/tar_writer.h"

#include <gtest/gtest.h>
#include <time.h>

#include <cstring>
#include <string>

#include "archive_file.h"
#include "support/failed_writes.h"

namespace {

const std::string NUL(1, '\0');

std::string zeros(size_t n) {
    return std::string(n, '\0');
}

TEST(TarWriter, WritesTheHeaderByteForByte) {
    ArchiveFile archive;
    time_t before = time(nullptr);
    tar_header(archive.tw, "dir/name", 1234);
    time_t after = time(nullptr);
    std::string header = archive.bytes();
    ASSERT_EQ(512u, header.size());
    EXPECT_EQ("top/dir/name" + zeros(88), header.substr(0, 100));
    EXPECT_EQ("0000644" + NUL, header.substr(100, 8));
    EXPECT_EQ("0000100" + NUL, header.substr(108, 8));
    EXPECT_EQ("0000100" + NUL, header.substr(116, 8));
    EXPECT_EQ("00000002322" + NUL, header.substr(124, 12));
    EXPECT_EQ(NUL, header.substr(147, 1));
    long mtime = strtol(header.substr(136, 11).c_str(), nullptr, 8);
    EXPECT_LE(before, mtime);
    EXPECT_GE(after, mtime);
    EXPECT_EQ("0", header.substr(156, 1));
    EXPECT_EQ(zeros(100), header.substr(157, 100));
    EXPECT_EQ("ustar" + NUL + "  ", header.substr(257, 8));
    EXPECT_EQ("admin" + zeros(27), header.substr(265, 32));
    EXPECT_EQ("admin" + zeros(27), header.substr(297, 32));
    EXPECT_EQ(zeros(183), header.substr(329));

    std::string blanked = header;
    blanked.replace(148, 8, 8, ' ');
    unsigned sum = 0;
    for (char c : blanked)
        sum += static_cast<unsigned char>(c);
    char digits[8];
    snprintf(digits, sizeof digits, "%06o", sum);
    EXPECT_EQ(digits + NUL + " ", header.substr(148, 8));
    tar_close(archive.tw);
}

TEST(TarWriter, SumsNameBytesAsUnsigned) {
    ArchiveFile archive;
    tar_header(archive.tw, "\xff\xfe\x80", 0);
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(1u, members.size());
    EXPECT_EQ("top/\xff\xfe\x80", members[0].name);
}

TEST(TarWriter, WithAnEmptyPrefixGivesNamesWithoutADirectory) {
    for (const char *prefix : {"", static_cast<const char *>(nullptr)}) {
        TempDir dir;
        UniqueFd fd(open((dir / "a").c_str(), O_WRONLY | O_CREAT, 0600));
        TarWriter *tw = tar_open(fd.get(), prefix);
        EXPECT_EQ(0u, tw->prefix_len);
        tar_header(tw, "name", 0);
        tar_close(tw);
        EXPECT_EQ("name", read_tar(read_whole_file(dir / "a")).at(0).name);
    }
}

TEST(TarWriter, PadsEveryMemberToABlockAndAFullOneNotAtAll) {
    ArchiveFile archive;
    for (uint32_t size : {0u, 1u, 511u, 512u, 513u, 1024u}) {
        std::string data(size, 'd');
        tar_header(archive.tw, std::to_string(size).c_str(), size);
        EXPECT_EQ(static_cast<int32_t>(size), tar_write(archive.tw, data.data(), size));
    }
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(6u, members.size());
    for (const TarMember &member : members)
        EXPECT_EQ(std::string(std::stoul(member.name.substr(4)), 'd'), member.data);
    // Headers, and 0, 1, 1, 1, 2 and 2 blocks of data; no end blocks.
    EXPECT_EQ((6u + 7u) * 512u, archive.bytes().size());
}

TEST(TarWriter, CountsDataThatWasWrittenToTheDescriptorDirectly) {
    ArchiveFile archive;
    tar_header(archive.tw, "a", 100);
    EXPECT_EQ(100, write(archive.fd.get(), std::string(100, 'x').data(), 100));
    tar_account(archive.tw, 100);
    tar_header(archive.tw, "b", 0);
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(2u, members.size());
    EXPECT_EQ(std::string(100, 'x'), members[0].data);
}

TEST(TarWriter, CountsDataWhoseWriteFailed) {
    BrokenArchive archive;
    EXPECT_EQ(-1, tar_write(archive.tw, "abc", 3));
    EXPECT_EQ(3u, archive.tw->member_bytes);
}

TEST(TarWriter, EndsOnABlockWithoutEndBlocks) {
    ArchiveFile archive;
    tar_header(archive.tw, "a", 3);
    tar_write(archive.tw, "abc", 3);
    tar_close(archive.tw);
    std::string bytes = archive.bytes();
    EXPECT_EQ(1024u, bytes.size());
    EXPECT_EQ("abc", bytes.substr(512, 3));
}

TEST(TarWriter, CutsNamesThatDoNotFitTheField) {
    ArchiveFile archive;
    tar_header(archive.tw, std::string(96, 'n').c_str(), 0);
    tar_header(archive.tw, std::string(300, 'n').c_str(), 0);
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(2u, members.size());
    for (const TarMember &member : members) {
        EXPECT_EQ("top/" + std::string(96, 'n'), member.name);
        EXPECT_EQ("0000644" + NUL, member.header.substr(100, 8));
    }
}

TEST(TarWriter, CutsAPrefixThatDoesNotFitTheField) {
    TempDir dir;
    UniqueFd fd(open((dir / "a").c_str(), O_WRONLY | O_CREAT, 0600));
    TarWriter *tw = tar_open(fd.get(), std::string(200, 'p').c_str());
    tar_header(tw, "name", 0);
    tar_close(tw);
    EXPECT_EQ(std::string(100, 'p'), read_tar(read_whole_file(dir / "a")).at(0).name);
}

TEST(TarPad, AdvancesTheCountToTheNextBlock) {
    TempDir dir;
    UniqueFd fd(open((dir / "a").c_str(), O_WRONLY | O_CREAT, 0600));
    uint32_t count = 1000;
    tar_pad(fd.get(), &count);
    EXPECT_EQ(1024u, count);
    tar_pad(fd.get(), &count);
    EXPECT_EQ(1024u, count);
    EXPECT_EQ(zeros(24), read_whole_file(dir / "a"));
}

TEST(WriteZeros, WritesExactlySoManyOrNone) {
    for (int64_t n : {-5, 0, 1, 100, 511, 512, 513, 5000}) {
        TempDir dir;
        UniqueFd fd(open((dir / "a").c_str(), O_WRONLY | O_CREAT, 0600));
        EXPECT_EQ(0, write_zeros(fd.get(), n));
        EXPECT_EQ(zeros(n > 0 ? static_cast<size_t>(n) : 0), read_whole_file(dir / "a"));
    }
}

TEST(WriteZeros, StopsAtTheFirstFailureAndSaysSo) {
    BrokenArchive archive;
    EXPECT_EQ(1, failed_writes([&] { EXPECT_EQ(1, write_zeros(archive.fd.get(), 5000)); }));
    EXPECT_EQ(0, write_zeros(archive.fd.get(), 0));
}

}  // namespace
