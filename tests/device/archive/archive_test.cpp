// Takes apart the archive of the scene that was set on the board (see scene), which lies in the
// folder BOARD_ARCHIVE.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "support/gunzip.h"
#include "support/packets.h"
#include "support/tar_reader.h"
#include "support/temp_dir.h"

namespace {

std::string folder() {
    const char *path = getenv("BOARD_ARCHIVE");
    return path != nullptr ? path : ".";
}

std::vector<std::string> lines_of(const std::string &file) {
    std::istringstream text(read_whole_file(folder() + "/" + file));
    std::vector<std::string> lines;
    for (std::string line; std::getline(text, line);)
        lines.push_back(line);
    return lines;
}

class BoardArchive : public testing::Test {
  protected:
    void SetUp() override {
        members_ = read_tar(gunzip(read_whole_file(folder() + "/debug.tgz")));
        ASSERT_LT(10u, members_.size());
        top_ = members_[0].name.substr(0, members_[0].name.find('/') + 1);
        for (const TarMember &member : members_) {
            ASSERT_EQ(top_, member.name.substr(0, top_.size()));
            names_.push_back(member.name.substr(top_.size()));
        }
    }

    // What `name` holds; fails the test when there is no such member.
    std::string data(const std::string &name) const {
        const TarMember *member = find_member(members_, top_ + name);
        EXPECT_NE(nullptr, member) << name;
        return member != nullptr ? member->data : "";
    }

    // The members between the process snapshots' first one and the end.
    std::vector<std::string> process_members() const {
        auto first = std::find_if(names_.begin(), names_.end(), [](const std::string &name) {
            return name.size() > 5 && name.substr(name.size() - 5) == "/core";
        });
        return {first, names_.end()};
    }

    // Where the two snapshots of /proc lie, by their time.
    std::vector<std::string> snapshots() const {
        std::vector<std::string> dirs;
        for (const std::string &name : names_) {
            const std::string dir = name.substr(0, name.find('/') + 1);
            if (dir.substr(0, 5) == "proc." &&
                std::find(dirs.begin(), dirs.end(), dir) == dirs.end())
                dirs.push_back(dir);
        }
        return dirs;
    }

    std::vector<TarMember> members_;
    std::vector<std::string> names_;  // without the top folder
    std::string top_;
};

TEST_F(BoardArchive, IsNamedForItsTimeAndNumber) {
    // "debug-20240131-235959-c0/"
    ASSERT_EQ(25u, top_.size());
    EXPECT_EQ("debug-", top_.substr(0, 6));
    EXPECT_EQ("-c0/", top_.substr(21));
}

TEST_F(BoardArchive, HoldsItsMembersInOrder) {
    std::vector<std::string> outline;
    for (const std::string &name : names_) {
        std::string entry = name;
        if (name.rfind("proc.", 0) == 0)
            entry = "proc.DATE-TIME/...";
        else if (name.rfind("proc/", 0) == 0)
            entry = "proc/...";
        if (outline.empty() || outline.back() != entry)
            outline.push_back(entry);
    }
    const std::vector<std::string> expected = {
        "dbg-monitor.txt",    "media.conf",  "proc.DATE-TIME/...", "proc/...",
        "strace.log",         "netdump.cap", "healthsheet.txt",    "oopslog",
        "proc.DATE-TIME/...", "proc/...",
    };
    ASSERT_LT(expected.size(), outline.size());
    EXPECT_EQ(expected, std::vector<std::string>(
                            outline.begin(), outline.begin() + static_cast<long>(expected.size())));
    // The kernel's memory image is larger than what an archive takes.
    EXPECT_EQ(names_.end(), std::find(names_.begin(), names_.end(), "kcore"));
}

TEST_F(BoardArchive, HoldsTheFilesAndTheOutputsThatWereThere) {
    EXPECT_EQ("status of the monitor\n", data("dbg-monitor.txt"));
    EXPECT_EQ("[media]\n", data("media.conf"));
    EXPECT_EQ("healthy\n", data("healthsheet.txt"));
}

TEST_F(BoardArchive, HoldsTheOopsLogOfTheFlashTheNewestReportLast) {
    EXPECT_EQ(
        "Last log is at position 0 with count 8\n"
        "Log Entry 7 (at position 1)\n"
        "older report\n"
        "Log Entry 8 (at position 0)\n"
        "newer report\n",
        data("oopslog"));
}

TEST_F(BoardArchive, HoldsEveryFileOfProcThatHasSomethingInBothSnapshots) {
    const std::vector<std::string> dirs = snapshots();
    ASSERT_EQ(2u, dirs.size());
    EXPECT_LT(dirs[0], dirs[1]);
    const std::vector<std::string> files = lines_of("proc");
    ASSERT_LT(20u, files.size());
    for (const std::string &dir : dirs) {
        for (const std::string &file : files)
            EXPECT_EQ(1, std::count(names_.begin(), names_.end(), dir + file)) << dir + file;
        for (const char *file : {"kcore", "kmsg"})
            EXPECT_EQ(0, std::count(names_.begin(), names_.end(), dir + file)) << dir + file;
    }
    for (const char *file : {"proc/sys/kernel/osrelease", "proc/sys/vm/swappiness", "proc/net/dev"})
        EXPECT_EQ(2, std::count(names_.begin(), names_.end(), file)) << file;
    // Trace and capture take five seconds each.
    const double first = strtod(data(dirs[0] + "uptime").c_str(), nullptr);
    EXPECT_LE(first + 9, strtod(data(dirs[1] + "uptime").c_str(), nullptr));
    EXPECT_NE(std::string::npos, data(dirs[1] + "cpuinfo").find("MIPS"));
}

TEST_F(BoardArchive, LeavesOutAndNamesWhatCannotBeRead) {
    std::set<std::string> named;
    for (const std::string &line : lines_of("debug.err")) {
        if (line.rfind("/proc/", 0) == 0)
            named.insert(line);
    }
    for (const char *line : {"/proc/sysrq-trigger: Input/output error",
                             "/proc/sys/vm/drop_caches: Bad file descriptor",
                             "/proc/sys/net/ipv4/route/flush: Bad file descriptor"})
        EXPECT_EQ(1u, named.count(line)) << line;
    for (const std::string &line : named) {
        const std::string path = line.substr(1, line.find(": ") - 1);
        EXPECT_EQ(nullptr, find_member(members_, top_ + path)) << path;
        const std::string file = path.substr(path.find('/') + 1);
        for (const std::string &dir : snapshots())
            EXPECT_EQ(nullptr, find_member(members_, top_ + dir + file)) << dir << file;
    }
}

TEST_F(BoardArchive, HoldsATraceOfExactlyItsSize) {
    const std::string trace = data("strace.log");
    EXPECT_EQ(204800u, trace.size());
    const std::string cat = "[" + lines_of("cat").at(0) + " cat] ";
    EXPECT_NE(std::string::npos, trace.find(cat + "3 open fds:\n"));
    // The call that it has been waiting in all the time.
    EXPECT_NE(std::string::npos, trace.find("] read(0 /root/fifo, 0x"));
    // What goes on, once a second.
    EXPECT_NE(std::string::npos, trace.find("[" + lines_of("ping").at(0) + " ping] "));
    for (char c : trace)
        ASSERT_TRUE(c == '\n' || c == '\t' || (c >= ' ' && c <= '~')) << static_cast<int>(c);
}

TEST_F(BoardArchive, HoldsACaptureOfExactlyItsSizeWithTheFramesOnTheWire) {
    const std::string stream = data("netdump.cap");
    EXPECT_EQ(512000u, stream.size());
    const PcapTestStream capture = parse_pcap(stream);
    EXPECT_EQ(from_hex("d4c3b2a1 0200 0400 00000000 00000000 ffff0000 01000000"), capture.header);
    EXPECT_EQ("", capture.rest);
    int requests = 0;
    int replies = 0;
    for (const PcapTestRecord &record : capture.records) {
        if (record.seconds == 0)
            continue;
        EXPECT_EQ(1536u, record.captured_length);
        EXPECT_LE(record.original_length, 1536u);
        // IPv4, ICMP, from the board to the gateway and back.
        const std::string &frame = record.data;
        if (frame.substr(12, 3) != from_hex("080045") || frame[23] != 1)
            continue;
        if (frame.substr(26, 9) == from_hex("0a00020f 0a000202 08"))
            ++requests;
        if (frame.substr(26, 9) == from_hex("0a000202 0a00020f 00"))
            ++replies;
    }
    EXPECT_LE(3, requests);
    EXPECT_LE(3, replies);
}

TEST_F(BoardArchive, HoldsCoreAndDescriptorsOfEveryProcessInTheOrderOfTheirNumbers) {
    const std::vector<std::string> left = process_members();
    ASSERT_EQ(0u, left.size() % 2);
    long before = 0;
    std::set<std::string> dirs;
    for (size_t i = 0; i < left.size(); i += 2) {
        const std::string dir = left[i].substr(0, left[i].find('/') + 1);
        EXPECT_EQ(dir + "core", left[i]);
        EXPECT_EQ(dir + "fdmap", left[i + 1]);
        const long number = strtol(dir.c_str() + dir.rfind('.') + 1, nullptr, 10);
        EXPECT_LT(before, number);
        before = number;
        dirs.insert(dir);
    }
    EXPECT_EQ(1u, dirs.count("cat." + lines_of("cat").at(0) + "/"));
    EXPECT_EQ(1u, dirs.count("ping." + lines_of("ping").at(0) + "/"));
}

TEST_F(BoardArchive, HoldsTheKernelsThreadsUnderADotAndTheirNumber) {
    const std::vector<std::string> threads = lines_of("threads");
    ASSERT_LT(20u, threads.size());
    for (const std::string &thread : threads) {
        EXPECT_EQ("thread " + thread + " of the kernel", data("." + thread + "/core"));
        EXPECT_EQ("total 0\n", data("." + thread + "/fdmap"));
    }
}

TEST_F(BoardArchive, HoldsTheDescriptorsOfAProcess) {
    const std::string map = data("cat." + lines_of("cat").at(0) + "/fdmap");
    for (const char *end : {" 0 -> /root/fifo\n", " 1 -> /root/out\n"})
        EXPECT_NE(std::string::npos, map.find(end)) << map;
}

uint32_t number_at(const std::string &bytes, size_t at, size_t size) {
    uint32_t number = 0;
    while (size-- > 0)
        number = number << 8 | static_cast<uint8_t>(bytes.at(at + size));
    return number;
}

TEST_F(BoardArchive, HoldsAWholeCoreWithTheProcesssMemory) {
    const std::string core = data("cat." + lines_of("cat").at(0) + "/core");
    ASSERT_LT(52u, core.size());
    // 32 bits, little-endian; a core; of MIPS.
    EXPECT_EQ(from_hex("7f454c46 01 01 01"), core.substr(0, 7));
    EXPECT_EQ(4u, number_at(core, 16, 2));
    EXPECT_EQ(8u, number_at(core, 18, 2));

    size_t end = 0;
    int loaded = 0;
    std::string notes;
    for (uint32_t i = 0; i < number_at(core, 44, 2); ++i) {
        const size_t header = number_at(core, 28, 4) + i * number_at(core, 42, 2);
        const uint32_t type = number_at(core, header, 4);
        const size_t offset = number_at(core, header + 4, 4);
        const size_t size = number_at(core, header + 16, 4);
        end = std::max(end, offset + size);
        ASSERT_LE(end, core.size());
        loaded += type == 1;
        if (type == 4)
            notes += core.substr(offset, size);
    }
    EXPECT_LE(3, loaded);
    EXPECT_LE(end, core.size());
    EXPECT_NE(std::string::npos, core.find("MARK=in the memory of cat"));
    // One of the notes of the name "CORE" is the state of the thread: its id stands at 24.
    uint32_t thread = 0;
    for (size_t at = 0; at + 20 <= notes.size();) {
        const size_t name_size = (number_at(notes, at, 4) + 3) & ~size_t{3};
        const size_t size = (number_at(notes, at + 4, 4) + 3) & ~size_t{3};
        if (number_at(notes, at + 8, 4) == 1 && notes.substr(at + 12, 4) == "CORE")
            thread = number_at(notes, at + 12 + name_size + 24, 4);
        at += 12 + name_size + size;
    }
    EXPECT_EQ(strtoul(lines_of("cat").at(0).c_str(), nullptr, 10), thread);
}

TEST_F(BoardArchive, HoldsACoreThatAnOrdinaryReaderUnderstands) {
    TempDir dir;
    dir.file("core", data("cat." + lines_of("cat").at(0) + "/core"));
    const std::string command = "readelf -hln " + dir / "core" + " >" + dir / "out" + " 2>&1";
    EXPECT_EQ(0, system(command.c_str()));
    const std::string text = read_whole_file(dir / "out");
    for (const char *part : {"CORE (Core file)", "MIPS R3000", "NT_PRSTATUS"})
        EXPECT_NE(std::string::npos, text.find(part)) << text;
    for (const char *part : {"Warning", "Error"})
        EXPECT_EQ(std::string::npos, text.find(part)) << text;
}

}  // namespace
