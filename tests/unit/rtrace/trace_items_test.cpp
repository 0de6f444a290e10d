#include "rtrace/trace_items.h"

#include <gtest/gtest.h>

namespace {

TEST(LookupTraceItem, KnowsEveryNameOfARequest) {
    EXPECT_EQ(0x1U, lookup_trace_item("smaps"));
    EXPECT_EQ(0x2U, lookup_trace_item("status"));
    EXPECT_EQ(0x4U, lookup_trace_item("smapstot"));
    EXPECT_EQ(0x8U, lookup_trace_item("filenr"));
    EXPECT_EQ(0x10U, lookup_trace_item("meminfo"));
    EXPECT_EQ(0x20U, lookup_trace_item("diskinfo"));
    EXPECT_EQ(0x40U, lookup_trace_item("iostat"));
    EXPECT_EQ(0x80U, lookup_trace_item("pagetypeinfo"));
    EXPECT_EQ(0x100U, lookup_trace_item("mediahub"));
    EXPECT_EQ(0x200U, lookup_trace_item("event"));
    EXPECT_EQ(0x400U, lookup_trace_item("pidstat"));
}

TEST(LookupTraceItem, AllLeavesOutThreeItemsAndIsNoSupersetOfFast) {
    EXPECT_EQ(0x67bU, lookup_trace_item("all"));
    EXPECT_EQ(0x67cU, lookup_trace_item("fast"));
}

TEST(LookupTraceItem, ComparesTheWholeNameCaseIncluded) {
    for (const char *name : {"", "smap", "smapss", "Smaps", "SMAPS", " smaps", "smaps ", "evsink"})
        EXPECT_EQ(0U, lookup_trace_item(name)) << name;
}

}  // namespace
