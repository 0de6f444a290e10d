#include "trace/argument_styles.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <random>
#include <string>

#include "support/guarded_buffer.h"
#include "support/temp_dir.h"
#include "unit/trace/made_up_mips_kernel.h"
#include "util/unique_fd.h"

namespace {

// No process has such a number, so its descriptors are bare numbers.
constexpr pid_t NOBODY = 99999999;

class ArgumentStyles : public testing::Test {
  protected:
    MadeUpMipsKernel kernel;
    Tracee tracee = {NOBODY, &MIPS_BACKEND};

    std::string string_arg(unsigned long address, long len, size_t size = 1024) {
        std::string buf(1024, '#');
        const int length = format_string_arg(tracee, buf.data(), size, address, len);
        EXPECT_EQ(strlen(buf.c_str()), static_cast<size_t>(length));
        return buf.c_str();
    }

    // Memory behind which more follows, so that the last bytes can be read word by word.
    void put_string(std::string_view bytes) { kernel.put(0x1000, std::string(bytes) + "...."); }

    std::string subcall_args(unsigned long subcall, std::span<const unsigned long, 6> x) {
        char buf[512];
        const int length = format_socketcall_args(tracee, buf, sizeof(buf), subcall, x);
        EXPECT_EQ(strlen(buf), static_cast<size_t>(length));
        return buf;
    }
};

std::string fd_arg(pid_t pid, unsigned long fd) {
    char buf[256];
    const int length = format_fd_arg({pid, &MIPS_BACKEND}, buf, sizeof(buf), fd);
    EXPECT_EQ(strlen(buf), static_cast<size_t>(length));
    return buf;
}

}  // namespace

TEST_F(ArgumentStyles, ShowWhatADescriptorRefersTo) {
    const UniqueFd null(open("/dev/null", O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(dup2(null.get(), 201), 201);
    EXPECT_EQ(fd_arg(getpid(), 201), "201 /dev/null");
    close(201);
}

TEST_F(ArgumentStyles, ShowTheBareNumberOfADescriptorThatIsNotOpen) {
    EXPECT_EQ(fd_arg(getpid(), 1023), "1023");
    EXPECT_EQ(fd_arg(getpid(), 0xffffffff), "-1");
    EXPECT_EQ(fd_arg(NOBODY, 3), "3");
}

TEST_F(ArgumentStyles, CutTheTextOfADescriptorTo127Characters) {
    const TempDir dir;
    const std::string path = dir.file(std::string(100, 'd') + "/" + std::string(100, 'f'), "");
    const UniqueFd file(open(path.c_str(), O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(dup2(file.get(), 201), 201);
    EXPECT_EQ(fd_arg(getpid(), 201), "201 " + path.substr(0, 127));
    close(201);
}

TEST_F(ArgumentStyles, FitADescriptorIntoAnySpace) {
    const UniqueFd null(open("/dev/null", O_RDONLY | O_CLOEXEC));
    ASSERT_EQ(dup2(null.get(), 201), 201);
    expect_prefix_at_every_size("201 /dev/null", [](char *buf, size_t size) {
        return format_fd_arg({getpid(), &MIPS_BACKEND}, buf, size, 201);
    });
    close(201);
}

TEST_F(ArgumentStyles, EndAStringAtItsZeroByte) {
    put_string(std::string_view("/etc/passwd\0/more", 17));
    EXPECT_EQ(string_arg(0x1000, -1), "\"/etc/passwd\"");
}

TEST_F(ArgumentStyles, ShowAnEmptyString) {
    put_string(std::string_view("\0abc", 4));
    EXPECT_EQ(string_arg(0x1000, -1), "\"\"");
}

TEST_F(ArgumentStyles, Show32CharactersOfALongString) {
    put_string("0123456789abcdef0123456789ABCDEFxyz");
    EXPECT_EQ(string_arg(0x1000, -1), "\"0123456789abcdef0123456789ABCDEF\"");
}

TEST_F(ArgumentStyles, ShowAllOf64BytesAnd32Of65) {
    put_string("0123456789abcdef0123456789ABCDEFghijklmnopqrstuvGHIJKLMNOPQRSTUV!");
    EXPECT_EQ(string_arg(0x1000, 64),
              "\"0123456789abcdef0123456789ABCDEFghijklmnopqrstuvGHIJKLMNOPQRSTUV\"");
    EXPECT_EQ(string_arg(0x1000, 65), "\"0123456789abcdef0123456789ABCDEF\"");
    EXPECT_EQ(string_arg(0x1000, 100), "\"0123456789abcdef0123456789ABCDEF\"");
    EXPECT_EQ(string_arg(0x1000, 33), "\"0123456789abcdef0123456789ABCDEFg\"");
    EXPECT_EQ(string_arg(0x1000, 2147483647), "\"0123456789abcdef0123456789ABCDEF\"");
}

TEST_F(ArgumentStyles, ShowASingleByte) {
    put_string("xyz");
    EXPECT_EQ(string_arg(0x1000, 1), "\"x\"");
}

TEST_F(ArgumentStyles, ReadNothingForALengthOfZeroOrBelow) {
    put_string("xyz");
    EXPECT_EQ(string_arg(0x1000, 0), "\"\"");
    EXPECT_EQ(string_arg(0x1000, -2), "\"\"");
    EXPECT_EQ(string_arg(0x1000, -2147483647L - 1), "\"\"");
    EXPECT_TRUE(kernel.requests.empty());
}

TEST_F(ArgumentStyles, EscapeNewlineReturnAndTab) {
    put_string("a\nb\rc\td");
    EXPECT_EQ(string_arg(0x1000, 7), "\"a\\nb\\rc\\td\"");
}

TEST_F(ArgumentStyles, CopyQuotesAndBackslashesAsTheyAre) {
    put_string("\"\\n'");
    EXPECT_EQ(string_arg(0x1000, 4), "\"\"\\n'\"");
}

TEST_F(ArgumentStyles, ShowOtherBytesInHexadecimalWithoutLeadingZero) {
    put_string("\x01\x1f \x7f~\x80\x0b\x1b\xc3\xa4");
    EXPECT_EQ(string_arg(0x1000, 10), "\"\\x1\\x1f \\x7f~\\x80\\xb\\x1b\\xc3\\xa4\"");
}

TEST_F(ArgumentStyles, ShowAZeroByteOfACountedString) {
    put_string(std::string_view("a\0b", 3));
    EXPECT_EQ(string_arg(0x1000, 3), "\"a\\x0b\"");
}

TEST_F(ArgumentStyles, ShowAWordOfMinusOneAsTheByteFF) {
    put_string("\xff\xff\xff\xff\xff\xff\xff\xff");
    EXPECT_EQ(string_arg(0x1000, 2), "\"\\xff\\xff\"");
}

TEST_F(ArgumentStyles, EndAStringWhereMemoryCannotBeRead) {
    kernel.put(0x1000, "abcdefgh");
    // Each byte is read as part of a word; the word at 'f' would lie partly outside.
    EXPECT_EQ(string_arg(0x1000, 8), "\"abcde\"");
    EXPECT_EQ(string_arg(0x1000, -1), "\"abcde\"");
    EXPECT_EQ(string_arg(0x1006, 8), "\"\"");
    EXPECT_EQ(string_arg(0, -1), "\"\"");
}

TEST_F(ArgumentStyles, WrapTheAddressesOfA32BitTracee) {
    kernel.put(0, "wrapped");
    kernel.put(0xfffffffc, "end!");
    if constexpr (sizeof(unsigned long) > 4) {
        // The word that straddles the end is made of bytes that this kernel keeps beyond it.
        for (unsigned long i = 0; i < 3; i++)
            kernel.memory[0xffffffffUL + 1 + i] = '?';
    }
    EXPECT_EQ(string_arg(0xfffffffc, 8), "\"end!wrap\"");
}

TEST_F(ArgumentStyles, CutAStringSoThatTheClosingQuoteFits) {
    put_string("abcdef");
    EXPECT_EQ(string_arg(0x1000, 6, 10), "\"abcdef\"");
    EXPECT_EQ(string_arg(0x1000, 6, 9), "\"abcde\"");
    EXPECT_EQ(string_arg(0x1000, 6, 8), "\"abcd\"");
    EXPECT_EQ(string_arg(0x1000, 6, 5), "\"a\"");
    EXPECT_EQ(string_arg(0x1000, 6, 4), "\"\"");
    EXPECT_EQ(string_arg(0x1000, 6, 3), "\"\"");
}

TEST_F(ArgumentStyles, LoseTheClosingQuoteWhenTheLastCharacterTakesItsRoom) {
    put_string("\xff\xff");
    char buf[8];
    memset(buf, '#', sizeof(buf));
    EXPECT_EQ(format_string_arg(tracee, buf, 5, 0x1000, 2), 6);
    EXPECT_EQ(std::string(buf, 8), std::string("\"\\xf\0###", 8));
    memset(buf, '#', sizeof(buf));
    EXPECT_EQ(format_string_arg(tracee, buf, 6, 0x1000, 2), 6);
    EXPECT_EQ(std::string(buf, 8), std::string("\"\\xff\0##", 8));
}

TEST_F(ArgumentStyles, CountTheQuotesOfAStringWithoutRoom) {
    put_string("abcdef");
    char buf[3] = {'#', '#', '#'};
    EXPECT_EQ(format_string_arg(tracee, buf, 0, 0x1000, 6), 2);
    EXPECT_EQ(std::string(buf, 3), "###");
    EXPECT_EQ(format_string_arg(tracee, buf, 1, 0x1000, 6), 2);
    EXPECT_EQ(std::string(buf, 3), std::string("\0##", 3));
    EXPECT_EQ(format_string_arg(tracee, buf, 2, 0x1000, 6), 2);
    EXPECT_EQ(std::string(buf, 3), std::string("\"\0#", 3));
}

// What should come out, said in another way: whole characters as long as each finds room for three
// more, and of that what fits.
TEST_F(ArgumentStyles, ShowAnyMemoryAtAnyLengthInAnySpace) {
    std::mt19937 random(20240229);
    GuardedBuffer buffer;
    for (int round = 0; round < 4000; round++) {
        const size_t mapped = random() % 90;
        const bool text = random() % 2 == 0;
        kernel.memory.clear();
        for (size_t i = 0; i < mapped; i++)
            kernel.memory[0x1000 + i] =
                static_cast<unsigned char>(text ? 32 + random() % 95 : random() % 256);
        const long len = static_cast<long>(random() % 75) - 3;
        const size_t size = random() % 120;

        std::string whole = "\"";
        const size_t limit = len == -1 || len > 64 ? 32 : len > 0 ? static_cast<size_t>(len) : 0;
        for (size_t i = 0; i < limit && i + 4 <= mapped && whole.size() + 3 < size; i++) {
            const unsigned char c = kernel.memory[0x1000 + i];
            char hex[8];
            snprintf(hex, sizeof(hex), "\\x%x", c);
            if (c == 0 && len == -1)
                break;
            const bool printable = c >= 32 && c < 127;
            whole += c == '\n'   ? "\\n"
                     : c == '\r' ? "\\r"
                     : c == '\t' ? "\\t"
                     : printable ? std::string(1, static_cast<char>(c))
                                 : hex;
        }
        whole += '"';

        char *buf = buffer.fresh(size);
        ASSERT_EQ(format_string_arg(tracee, buf, size, 0x1000, len), static_cast<int>(whole.size()))
            << "round " << round;
        ASSERT_TRUE(buffer.front_is_untouched(size));
        if (size > 0) {
            ASSERT_EQ(std::string(buf), whole.substr(0, size - 1)) << "round " << round;
        }
    }
}

TEST_F(ArgumentStyles, ShowPairsOfSignedNumbers) {
    kernel.put_word(0x2000, 5);
    kernel.put_word(0x2004, 0xfffffff9);
    char buf[64];
    EXPECT_EQ(format_pair_arg(tracee, buf, sizeof(buf), 0x2000, true), 11);
    EXPECT_STREQ(buf, "{ 5, -7 }, ");
    EXPECT_EQ(format_pair_arg(tracee, buf, sizeof(buf), 0x2000, false), 10);
    EXPECT_STREQ(buf, "{ 5, -7 })");
}

TEST_F(ArgumentStyles, ShowWhatCannotBeReadOfAPairAsMinusOne) {
    kernel.put_word(0x2000, 5);
    char buf[64];
    format_pair_arg(tracee, buf, sizeof(buf), 0x2000, false);
    EXPECT_STREQ(buf, "{ 5, -1 })");
    format_pair_arg(tracee, buf, sizeof(buf), 0, false);
    EXPECT_STREQ(buf, "{ -1, -1 })");
}

TEST_F(ArgumentStyles, FitAPairIntoAnySpace) {
    kernel.put_word(0x2000, 5);
    kernel.put_word(0x2004, 123456789);
    expect_prefix_at_every_size("{ 5, 123456789 }, ", [this](char *buf, size_t size) {
        return format_pair_arg(tracee, buf, size, 0x2000, true);
    });
}

TEST_F(ArgumentStyles, ShowTheArgumentsOfEachSocketSubcall) {
    kernel.put(0x3000, "ping\n....");
    const unsigned long x[6] = {4, 0x3000, 5, 0x4000, 0x80001234, 0xfffffff0};
    EXPECT_EQ(subcall_args(1, x), "4, 12288, 5)");
    EXPECT_EQ(subcall_args(2, x), "4, 0x3000, 5)");
    EXPECT_EQ(subcall_args(3, x), "4, 0x3000, 5)");
    EXPECT_EQ(subcall_args(11, x), "4, \"ping\\n\", 5, 0x4000, 0x80001234, -16)");
    EXPECT_EQ(subcall_args(12, x), "4, \"ping\\n\", 0x4000, 0x80001234, 0xfffffff0)");
    EXPECT_EQ(subcall_args(13, x), "4, 12288)");
    EXPECT_EQ(subcall_args(14, x), "4, 12288, 5, 0x4000, 0x80001234)");
    EXPECT_EQ(subcall_args(16, x), "4, 0x3000, 5)");
    EXPECT_EQ(subcall_args(17, x), "4, 0x3000, 5)");
}

TEST_F(ArgumentStyles, ShowSixNumbersForAllOtherSubcalls) {
    const unsigned long x[6] = {4, 0x3000, 5, 0x4000, 0x80001234, 0xfffffff0};
    for (unsigned long subcall :
         {0UL, 4UL, 5UL, 6UL, 7UL, 8UL, 9UL, 10UL, 15UL, 18UL, 19UL, 31UL, 33UL, 0xffffffffUL})
        EXPECT_EQ(subcall_args(subcall, x), "4, 12288, 5, 16384, 2147488308, 4294967280)")
            << subcall;
}

TEST_F(ArgumentStyles, ShowTheSignOfSubcallArgumentsWhereTheyHaveOne) {
    const unsigned long x[6] = {0xffffffff, 0xffffffff, 0xffffffff,
                                0xffffffff, 0xffffffff, 0xffffffff};
    EXPECT_EQ(subcall_args(1, x), "4294967295, 4294967295, 4294967295)");
    EXPECT_EQ(subcall_args(2, x), "-1, 0xffffffff, -1)");
    EXPECT_EQ(subcall_args(11, x), "-1, \"\", -1, 0xffffffff, 0xffffffff, -1)");
    EXPECT_EQ(subcall_args(12, x), "-1, \"\", 0xffffffff, 0xffffffff, 0xffffffff)");
    EXPECT_EQ(subcall_args(13, x), "-1, -1)");
    EXPECT_EQ(subcall_args(14, x), "-1, -1, -1, 0xffffffff, 0xffffffff)");
    EXPECT_EQ(subcall_args(16, x), "-1, 0xffffffff, ffffffff)");
    EXPECT_EQ(subcall_args(17, x), "-1, 0xffffffff, -1)");
}

TEST_F(ArgumentStyles, FitSubcallArgumentsIntoAnySpace) {
    const unsigned long x[6] = {4, 0x3000, 5, 0x4000, 0x5000, 6};
    expect_prefix_at_every_size("4, 12288, 5, 0x4000, 0x5000)", [&](char *buf, size_t size) {
        return format_socketcall_args(tracee, buf, size, 14, x);
    });
}

TEST_F(ArgumentStyles, NameThePtraceRequestsThatHaveAlwaysBeenThere) {
    const std::pair<unsigned long, const char *> requests[] = {
        {0, "0"},
        {1, "PTRACE_PEEKTEXT"},
        {2, "PTRACE_PEEKDATA"},
        {3, "PTRACE_PEEKUSER"},
        {4, "PTRACE_POKETEXT"},
        {5, "PTRACE_POKEDATA"},
        {6, "PTRACE_POKEUSER"},
        {7, "7"},
        {8, "8"},
        {12, "12"},
        {15, "15"},
        {16, "PTRACE_ATTACH"},
        {17, "17"},
        {23, "23"},
        {24, "PTRACE_SYSCALL"},
        {25, "25"},
        {0x4200, "16896"},
        {0x4206, "16902"},
        {0xffffffff, "-1"},
    };
    for (const auto &[request, name] : requests) {
        char buf[64];
        const unsigned long values[] = {request};
        format_arguments(tracee, buf, sizeof(buf), "%r0", values);
        EXPECT_STREQ(buf, name);
    }
}

TEST(ReadProcessMemory, ReadsAtAnOffset) {
    const char text[] = "some bytes of this process";
    char buf[8] = {};
    const auto address = static_cast<off64_t>(reinterpret_cast<uintptr_t>(text));
    EXPECT_EQ(read_process_memory(getpid(), buf, 5, address + 5), 5);
    EXPECT_STREQ(buf, "bytes");
}

TEST(ReadProcessMemory, FailsWhereNothingIsMappedAndWithoutAProcess) {
    char buf[8];
    EXPECT_EQ(read_process_memory(getpid(), buf, sizeof(buf), 4), -1);
    EXPECT_EQ(read_process_memory(NOBODY, buf, sizeof(buf), 0), -1);
}
