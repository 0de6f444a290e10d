#include "archive/proc_snapshot.h"

#include <gtest/gtest.h>
#include <sys/resource.h>

#include <algorithm>
#include <set>
#include <string>

#include "archive_file.h"
#include "support/sandbox.h"

namespace {

TEST(CopyDirFiles, CopiesTheFilesOfADirectoryOneLevelDeep) {
    ArchiveFile archive;
    TempDir source;
    source.file("one", "1");
    source.file("two", std::string(150000, '2'));
    source.file("empty", "");
    source.file("skipped", "x");
    source.file("sub/three", "3");
    const char *const skip[] = {"skipped", nullptr};
    EXPECT_EQ(0, copy_dir_files(archive.tw, archive.fd.get(), "in/", (source.path() + "/").c_str(),
                                skip));
    std::vector<TarMember> members = archive.close();
    ASSERT_EQ(2u, members.size());
    EXPECT_EQ("1", find_member(members, "top/in/one")->data);
    EXPECT_EQ(102400u, find_member(members, "top/in/two")->data.size());
}

TEST(CopyDirFiles, SkipsNothingWithoutAList) {
    ArchiveFile archive;
    TempDir source;
    source.file("kcore", "1");
    EXPECT_EQ(0, copy_dir_files(archive.tw, archive.fd.get(), "", (source.path() + "/").c_str(),
                                nullptr));
    EXPECT_EQ(1u, archive.close().size());
}

TEST(CopyDirFiles, SaysWhenADirectoryCannotBeOpened) {
    ArchiveFile archive;
    EXPECT_EQ(1, copy_dir_files(archive.tw, archive.fd.get(), "", "/nonexistent/", nullptr));
    EXPECT_EQ(0u, archive.close().size());
}

TEST(SnapshotProc, HoldsTheTopLevelAndThe26DirectoriesInOrder) {
    const std::vector<std::string> dirs = {"sys/",
                                           "sys/fs/",
                                           "sys/kernel/",
                                           "sys/kernel/random/",
                                           "sys/net/bridge/",
                                           "sys/net/core/",
                                           "sys/net/ipv4/",
                                           "sys/net/ipv4/conf/",
                                           "sys/net/ipv4/neigh/",
                                           "sys/net/ipv4/route/",
                                           "sys/net/ipv6/",
                                           "sys/net/ipv6/conf/",
                                           "sys/net/ipv6/icmp/",
                                           "sys/net/ipv6/neigh/",
                                           "sys/net/ipv6/route/",
                                           "sys/net/unix/",
                                           "sys/vm/",
                                           "driver/",
                                           "net/",
                                           "net/dev_snmp6/",
                                           "net/ip6t_hashlimit/",
                                           "net/ipt_hashlimit/",
                                           "net/netfilter/",
                                           "net/rpc/",
                                           "net/stat/",
                                           "net/vlan/"};
    run_in_sandbox([&] {
        TempDir fake;
        for (const char *name : {"kcore", "vmcore", "kmem", "kmsg", "meminfo"})
            fake.file(name, name);
        for (const std::string &dir : dirs)
            fake.file(dir + "file", dir);
        for (const char *other : {"bus/file", "123/file"})
            fake.file(other, "not taken");
        ArchiveFile archive;
        sandbox_bind(fake.path(), "/proc");
        EXPECT_EQ(0, snapshot_proc(archive.tw, archive.fd.get()));
        std::vector<TarMember> members = archive.close();
        ASSERT_EQ(27u, members.size());
        // "proc.20240131-235959/"
        std::string first = members[0].name.substr(4);
        EXPECT_EQ("proc.", first.substr(0, 5));
        EXPECT_EQ("-", first.substr(13, 1));
        EXPECT_EQ(std::string::npos,
                  (first.substr(5, 8) + first.substr(14, 6)).find_first_not_of("0123456789"));
        EXPECT_EQ("/meminfo", first.substr(20));
        EXPECT_EQ("meminfo", members[0].data);
        for (size_t i = 0; i < dirs.size(); ++i) {
            EXPECT_EQ("top/proc/" + dirs[i] + "file", members[i + 1].name);
            EXPECT_EQ(dirs[i], members[i + 1].data);
        }
    });
}

TEST(SnapshotProc, SaysWhenProcCannotBeOpened) {
    run_in_sandbox([] {
        ArchiveFile archive;
        // Descriptors run out, so that no directory opens.
        rlimit none = {0, 0};
        ASSERT_EQ(0, setrlimit(RLIMIT_NOFILE, &none));
        EXPECT_EQ(1, snapshot_proc(archive.tw, archive.fd.get()));
        tar_close(archive.tw);
    });
}

TEST(SnapshotProc, OfThisMachineHoldsWhatEveryKernelHas) {
    run_in_sandbox([] {
        ArchiveFile archive;
        EXPECT_EQ(0, snapshot_proc(archive.tw, archive.fd.get()));
        std::vector<TarMember> members = archive.close();
        std::set<std::string> names;
        for (const TarMember &member : members)
            names.insert(member.name);
        std::string stamp = members.at(0).name.substr(0, members[0].name.rfind('/') + 1);
        for (const char *name : {"meminfo", "cpuinfo", "mounts", "version", "uptime"})
            EXPECT_TRUE(names.count(stamp + name)) << name;
        for (const char *name : {"sys/kernel/osrelease", "sys/vm/swappiness", "net/dev", "net/tcp",
                                 "sys/net/ipv4/ip_forward"})
            EXPECT_TRUE(names.count("top/proc/" + std::string(name))) << name;
        EXPECT_FALSE(names.count(stamp + "kcore"));
        EXPECT_FALSE(names.count(stamp + "kmsg"));
    });
}

}  // namespace
