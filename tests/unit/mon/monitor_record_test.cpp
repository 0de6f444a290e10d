#include "mon/monitor_record.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <string>
#include <vector>

namespace {

using Counts = std::vector<int>;

// One field of the history, by place.
Counts totals(const MonitorRecord &record) {
    Counts result;
    for (const DescriptorCounts &counts : record.history)
        result.push_back(counts.total);
    return result;
}

// A history of rounds 1 to `last`, in each of which `total(round)` descriptors were counted.
template <typename Total>
Counts totals_after(uint32_t last, Total total) {
    MonitorRecord record = {};
    for (uint32_t round = 1; round <= last; ++round)
        add_to_history(&record, round, {total(round), 0, 0});
    return totals(record);
}

TEST(History, HoldsTheLastFourRoundsNewestFirst) {
    auto hundreds = [](uint32_t round) { return static_cast<int>(100 * round); };
    EXPECT_EQ((Counts{100, 0, 0, 0, 25, 0, 0, 0}), totals_after(1, hundreds));
    EXPECT_EQ((Counts{400, 300, 200, 100}), Counts([&] {
                  Counts all = totals_after(4, hundreds);
                  all.resize(4);
                  return all;
              }()));
    EXPECT_EQ((Counts{600, 500, 400, 300}), Counts([&] {
                  Counts all = totals_after(6, hundreds);
                  all.resize(4);
                  return all;
              }()));
}

TEST(History, AveragesThisRoundAndThoseTwoThreeAndFourBack) {
    // The round before this one is not in it.
    const int samples[] = {1000, 2000, 4000, 8000, 16000, 32000};
    auto sample = [&](uint32_t round) { return samples[round - 1]; };
    EXPECT_EQ(1000 / 4, totals_after(1, sample)[4]);
    EXPECT_EQ(2000 / 4, totals_after(2, sample)[4]);
    EXPECT_EQ((4000 + 1000) / 4, totals_after(3, sample)[4]);
    EXPECT_EQ((8000 + 2000 + 1000) / 4, totals_after(4, sample)[4]);
    EXPECT_EQ((16000 + 4000 + 2000 + 1000) / 4, totals_after(5, sample)[4]);
    EXPECT_EQ((32000 + 8000 + 4000 + 2000) / 4, totals_after(6, sample)[4]);
}

TEST(History, RoundsAveragesDownAndTreatsTheFieldsAlike) {
    MonitorRecord record = {};
    add_to_history(&record, 1, {7, 3, 9});
    EXPECT_EQ(7, record.history[0].total);
    EXPECT_EQ(3, record.history[0].sockets);
    EXPECT_EQ(9, record.history[0].pipes);
    EXPECT_EQ(1, record.history[4].total);
    EXPECT_EQ(0, record.history[4].sockets);
    EXPECT_EQ(2, record.history[4].pipes);
    add_to_history(&record, 2, {1, 1, 1});
    add_to_history(&record, 3, {2, 30, 4});
    EXPECT_EQ(9 / 4, record.history[4].total);
    EXPECT_EQ(33 / 4, record.history[4].sockets);
    EXPECT_EQ(13 / 4, record.history[4].pipes);
    EXPECT_EQ(3, record.history[2].sockets);
    EXPECT_EQ(9, record.history[2].pipes);
}

TEST(History, AddsUpAsUnsignedNumbers) {
    // Four times 0x40000000 is 0 again, and twice is 0x80000000.
    EXPECT_EQ(0, totals_after(5, [](uint32_t) { return 0x40000000; })[4]);
    EXPECT_EQ(0x20000000, totals_after(3, [](uint32_t) { return 0x40000000; })[4]);
}

TEST(History, KeepsTheAverageOfTheRoundBeforeEachMultipleOf32) {
    // Every round counts its own number; the average after round 31 is that of 31, 29, 28 and 27.
    auto number = [](uint32_t round) { return static_cast<int>(round); };
    EXPECT_EQ((Counts{31, 30, 29, 28, 28, 0, 0, 0}), totals_after(31, number));
    EXPECT_EQ((Counts{32, 31, 30, 29, 29, 28, 0, 0}), totals_after(32, number));
    EXPECT_EQ((Counts{63, 62, 61, 60, 60, 28, 0, 0}), totals_after(63, number));
    EXPECT_EQ((Counts{64, 63, 62, 61, 61, 60, 28, 0}), totals_after(64, number));
    EXPECT_EQ((Counts{96, 95, 94, 93, 93, 92, 60, 28}), totals_after(96, number));
    EXPECT_EQ((Counts{128, 127, 126, 125, 125, 124, 92, 60}), totals_after(128, number));
}

TEST(FdScore, Of40FilesAnd8SocketsIs2) {
    EXPECT_EQ(2, fd_score({48, 8, 0}));
}

TEST(FdScore, Of40FilesAnd300SocketsIs38) {
    EXPECT_EQ(38, fd_score({340, 300, 0}));
}

TEST(FdScore, RoundsEachPartDownOnItsOwn) {
    EXPECT_EQ(0, fd_score({31 + 7 + 31, 7, 31}));
    EXPECT_EQ(1, fd_score({32, 0, 0}));
    EXPECT_EQ(1, fd_score({8, 8, 0}));
    EXPECT_EQ(1, fd_score({32, 0, 32}));
    EXPECT_EQ(0, fd_score({0, 0, 0}));
    // Towards zero, should a count ever have been taken too low.
    EXPECT_EQ(0, fd_score({0, 0, 31}));
    EXPECT_EQ(0, fd_score({0, 0, 32}));
    EXPECT_EQ(4, fd_score({0, 40, 0}));
}

// A table of records, with rounds in which some processes are listed.
class Family {
  public:
    struct Listed {
        pid_t pid;
        pid_t ppid;
    };

    Family() : table_(hash_create(512)) {}
    ~Family() {
        HashCursor cursor = {};
        while (MonitorRecord *record = next_record(table_, &cursor)) {
            drop_record(table_, record);
            cursor = {};
        }
        hash_destroy(table_);
    }
    void round(uint32_t number, const std::vector<Listed> &processes) {
        for (const Listed &process : processes) {
            MonitorRecord *record = find_record(table_, process.pid);
            if (record == nullptr) {
                record = static_cast<MonitorRecord *>(calloc(1, sizeof *record));
                record->pid = process.pid;
                EXPECT_EQ(0, insert_record(table_, record));
            }
            count_as_child(table_, record, process.ppid, number);
        }
    }
    MonitorRecord *operator[](pid_t pid) { return find_record(table_, pid); }
    void drop(pid_t pid) { drop_record(table_, (*this)[pid]); }

  private:
    HashTable *table_;
};

TEST(ChildCount, CountsTheChildrenOfEachRoundAnew) {
    Family family;
    family.round(1, {{10, 1}, {11, 10}, {12, 10}, {13, 12}});
    EXPECT_EQ(2, family[10]->children);
    EXPECT_EQ(0, family[11]->children);
    EXPECT_EQ(1, family[12]->children);
    family.round(2, {{10, 1}, {11, 10}, {12, 10}, {13, 12}});
    EXPECT_EQ(2, family[10]->children);
    family.round(3, {{10, 1}, {12, 10}});
    EXPECT_EQ(1, family[10]->children);
    EXPECT_EQ(0, family[12]->children);
    family.round(4, {{10, 1}});
    EXPECT_EQ(0, family[10]->children);
    EXPECT_EQ(5u, family[10]->children_mark);
}

TEST(ChildCount, CountsChildrenThatAreListedBeforeTheirParent) {
    Family family;
    // In the first round the parent is not known yet.
    family.round(1, {{11, 20}, {12, 20}, {20, 1}, {21, 20}});
    EXPECT_EQ(1, family[20]->children);
    family.round(2, {{11, 20}, {12, 20}, {20, 1}, {21, 20}});
    EXPECT_EQ(3, family[20]->children);
    family.round(3, {{12, 20}, {20, 1}});
    EXPECT_EQ(1, family[20]->children);
    family.round(4, {{20, 1}});
    EXPECT_EQ(0, family[20]->children);
}

TEST(ChildCount, CountsForNobodyWhenTheParentIsNotWatched) {
    Family family;
    family.round(1, {{10, 1}, {11, -1}, {12, 0}});
    EXPECT_EQ(nullptr, family[10]->parent);
    EXPECT_EQ(1, family[10]->ppid);
    EXPECT_EQ(-1, family[11]->ppid);
    EXPECT_EQ(0, family[12]->ppid);
    for (pid_t pid : {10, 11, 12})
        EXPECT_EQ(0, family[pid]->children);
}

TEST(ChildCount, FollowsAChildToAnotherParent) {
    Family family;
    family.round(1, {{10, 1}, {11, 1}, {12, 10}});
    EXPECT_EQ(family[10], family[12]->parent);
    family.round(2, {{10, 1}, {11, 1}, {12, 11}});
    EXPECT_EQ(family[11], family[12]->parent);
    EXPECT_EQ(0, family[10]->children);
    EXPECT_EQ(1, family[11]->children);
    family.round(3, {{10, 1}, {11, 1}, {12, 1}});
    EXPECT_EQ(nullptr, family[12]->parent);
    EXPECT_EQ(0, family[11]->children);
}

TEST(ChildCount, DoesNotRememberAParentThatHasGone) {
    Family family;
    family.round(1, {{10, 1}, {11, 10}, {12, 10}});
    family.drop(10);
    EXPECT_EQ(nullptr, family[11]->parent);
    EXPECT_EQ(nullptr, family[12]->parent);
    // Another process of that id may have been made since.
    family.round(2, {{11, 1}, {12, 10}, {10, 1}});
    family.round(3, {{11, 1}, {12, 10}, {10, 1}});
    EXPECT_EQ(family[10], family[12]->parent);
    EXPECT_EQ(1, family[10]->children);
}

TEST(ChildCount, TakesARememberedParentOfAnotherPidForStale) {
    Family family;
    family.round(1, {{10, 1}, {11, 1}, {12, 10}});
    // As after a change of parents that nobody has looked at yet.
    family[12]->parent = family[11];
    family.round(2, {{10, 1}, {11, 1}, {12, 10}});
    EXPECT_EQ(family[10], family[12]->parent);
    EXPECT_EQ(1, family[10]->children);
    EXPECT_EQ(0, family[11]->children);
}

TEST(ChildCount, GoesOnWhenTheRoundNumbersBeginAgain) {
    Family family;
    for (uint32_t round : {0xfffffffeu, 0xffffffffu, 0u, 1u}) {
        family.round(round, {{10, 1}, {11, 10}, {12, 10}});
        EXPECT_EQ(2, family[10]->children) << round;
    }
}

TEST(Record, LiesInTheTableUnderTheBytesOfItsPid) {
    Family family;
    family.round(1, {{1000, 1}});
    EXPECT_EQ(4u, family[1000]->link.key_length);
    EXPECT_EQ(std::string("\xe8\x03\0\0", 4),
              std::string(static_cast<const char *>(family[1000]->link.key), 4));
}

}  // namespace
