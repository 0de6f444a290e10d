// Strings read from a tracee at once come out as if each byte had been peeked.
#include <gtest/gtest.h>
#include <string.h>
#include <sys/mman.h>
#include <unistd.h>

#include <random>
#include <string>

#include "trace/argument_styles.h"
#include "trace/backend.h"
#include "unit/trace/tracees.h"

namespace {

std::string string_arg(const TraceBackend &backend, pid_t pid, unsigned long address, long len) {
    char buf[512];
    EXPECT_LT(format_string_arg({pid, &backend}, buf, sizeof buf, address, len), 512);
    return buf;
}

// Pages of random bytes, among them many that strings treat specially; the tracee inherits them.
class TraceeBlock : public testing::Test {
  protected:
    static constexpr int PAGES = 8;
    size_t page_ = static_cast<size_t>(sysconf(_SC_PAGESIZE));
    unsigned char *memory_ = static_cast<unsigned char *>(
        mmap(nullptr, PAGES *page_, PROT_READ | PROT_WRITE, MAP_PRIVATE | MAP_ANONYMOUS, -1, 0));

    void SetUp() override {
        ASSERT_NE(memory_, MAP_FAILED);
        std::mt19937 random(7);
        const unsigned char special[] = {0, '\n', '\r', '\t', 0xff, 0x7f, 'a', '"'};
        for (size_t i = 0; i < PAGES * page_; i++)
            memory_[i] = random() % 16 != 0 ? static_cast<unsigned char>(random())
                                            : special[random() % sizeof special];
    }
    void TearDown() override { munmap(memory_, PAGES * page_); }

    unsigned long start_of(int page) const {
        return reinterpret_cast<unsigned long>(memory_) + static_cast<unsigned long>(page) * page_;
    }

    // Compares the two ways from somewhat before to somewhat behind the start of page `page`.
    void compare_around(pid_t pid, int page) {
        const TraceBackend &at_once = native_backend();
        TraceBackend by_peeks = at_once;
        by_peeks.read_block = nullptr;
        for (unsigned long back = 80; back + 9 > 0; back--) {
            const unsigned long address = start_of(page) - back;
            for (long len : {-1L, 0L, 1L, 2L, 7L, 31L, 33L, 63L, 64L, 65L, 4000L})
                ASSERT_EQ(string_arg(by_peeks, pid, address, len),
                          string_arg(at_once, pid, address, len))
                    << back << " bytes before the page, length " << len;
        }
    }
};

}  // namespace

TEST_F(TraceeBlock, GivesTheSameAcrossPagesThatAreThere) {
    Child child(sleep_for_ever, Child::HELD);
    compare_around(child.pid(), 1);
}

TEST_F(TraceeBlock, GivesTheSameBeforeAHoleInTheMemory) {
    Child child([] {}, Child::HELD);  // made before the hole, so that the comparison is not empty
    ASSERT_EQ(munmap(memory_ + 2 * page_, page_), 0);
    Child with_hole(sleep_for_ever, Child::HELD);
    compare_around(with_hole.pid(), 2);
    compare_around(with_hole.pid(), 3);
    EXPECT_NE(string_arg(native_backend(), child.pid(), start_of(2), 8),
              string_arg(native_backend(), with_hole.pid(), start_of(2), 8));
}

TEST_F(TraceeBlock, GivesTheSameWhereNoAccessIsAllowed) {
    const std::string readable = [&] {
        Child child(sleep_for_ever, Child::HELD);
        return string_arg(native_backend(), child.pid(), start_of(4), 64);
    }();
    ASSERT_EQ(mprotect(memory_ + 4 * page_, page_, PROT_NONE), 0);
    ASSERT_EQ(mprotect(memory_ + 5 * page_, page_, PROT_EXEC), 0);
    Child child(sleep_for_ever, Child::HELD);
    compare_around(child.pid(), 4);
    compare_around(child.pid(), 5);
    compare_around(child.pid(), 6);
    // Peeks can read there, so that both can.
    EXPECT_EQ(readable, string_arg(native_backend(), child.pid(), start_of(4), 64));
}

TEST_F(TraceeBlock, GivesTheSameAtBothEndsOfTheAddresses) {
    Child child(sleep_for_ever, Child::HELD);
    TraceBackend by_peeks = native_backend();
    by_peeks.read_block = nullptr;
    for (unsigned long address : {0UL, 1UL, ~0UL - 70, ~0UL - 8, ~0UL - 1, ~0UL}) {
        for (long len : {-1L, 1L, 64L})
            EXPECT_EQ(string_arg(by_peeks, child.pid(), address, len),
                      string_arg(native_backend(), child.pid(), address, len));
    }
}

TEST_F(TraceeBlock, ReadsAStringWithoutPeeks) {
    static int peeks;
    TraceBackend counting = native_backend();
    counting.peek = [](pid_t pid, unsigned long address, unsigned long *word) {
        ++peeks;
        return native_backend().peek(pid, address, word);
    };
    Child child(sleep_for_ever, Child::HELD);
    peeks = 0;
    (void)string_arg(counting, child.pid(), start_of(0), 64);
    EXPECT_EQ(peeks, 0);
    (void)string_arg(counting, 99999999, start_of(0), 64);
    EXPECT_EQ(peeks, 1) << "the comparisons above are of two different ways";
}
