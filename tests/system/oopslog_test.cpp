// The oops log reader, on block devices and on raw flash as far as the machine has them.
#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <mtd/mtd-user.h>
#include <stdio.h>
#include <string.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>
#include <functional>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "support/log_devices.h"
#include "support/oops_image.h"
#include "support/refused_calls.h"
#include "support/run_program.h"
#include "support/temp_dir.h"

namespace {

const char *const USAGE = "USAGE: oopslog [options] mtdblock-device\n\n";

TEST(Oopslog, WithoutADeviceShowsItsUsageAndAnEmptyLine) {
    for (const std::vector<std::string> &words :
         {std::vector<std::string>{"oopslog"}, {"oopslog", "-r"}}) {
        RunResult result = run_fieldkit(words);
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ(USAGE, result.out);
        EXPECT_EQ("", result.err);
    }
}

TEST(Oopslog, TakesAnyOtherFirstArgumentForTheDevice) {
    for (const char *word : {"-R", "-rr", "-r ", "--", "--help", ""}) {
        RunResult result = run_fieldkit({"oopslog", word, "/dev/null"});
        EXPECT_EQ(1, result.exit_status) << word;
        EXPECT_EQ("", result.out);
        EXPECT_EQ("open: No such file or directory\n", result.err) << word;
    }
    // The option itself stands for a device where it comes second.
    EXPECT_EQ("open: No such file or directory\n", run_fieldkit({"oopslog", "-r", "-r"}).err);
}

TEST(Oopslog, NamesTheErrorOfADeviceThatCannotBeOpened) {
    TempDir dir;
    RunResult result = run_fieldkit({"oopslog", dir / "nosuch"});
    EXPECT_EQ(1, result.exit_status);
    EXPECT_EQ("", result.out);
    EXPECT_EQ("open: No such file or directory\n", result.err);
    dir.file("file", "");
    EXPECT_EQ("open: Not a directory\n", run_fieldkit({"oopslog", "-r", dir / "file/x"}).err);
}

TEST(Oopslog, TakesAFileForFlashThatDoesNotAnswer) {
    TempDir dir;
    for (const std::string &path :
         {dir.file("image", oops_page(1, "one")), dir.path(), std::string("/dev/null")}) {
        RunResult result = run_fieldkit({"oopslog", path});
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("", result.out);
        EXPECT_EQ("MEMGETINFO: Inappropriate ioctl for device\n", result.err);
    }
}

// All of them give the same.
struct DeviceKind {
    const char *name;
    std::unique_ptr<LogDevice> (*make)(const TempDir &dir, const std::string &image);
};

const DeviceKind DEVICE_KINDS[] = {
    {"loop device",
     [](const TempDir &dir, const std::string &image) {
         return make_loop_device(dir.file("image", image));
     }},
    {"raw flash",
     [](const TempDir &, const std::string &image) {
         return make_flash_device(image, FlashNode::RAW);
     }},
    {"flash as a block device",
     [](const TempDir &, const std::string &image) {
         return make_flash_device(image, FlashNode::BLOCK);
     }},
};

// Runs `body` with one device after the other that has this image on it, of each kind that this
// machine has.
void with_each_device(const std::string &image,
                      const std::function<void(const std::string &device)> &body) {
    std::string reasons;
    bool found = false;
    for (const DeviceKind &kind : DEVICE_KINDS) {
        SCOPED_TRACE(kind.name);
        TempDir dir;
        const std::unique_ptr<LogDevice> device = kind.make(dir, image);
        if (device->path.empty()) {
            reasons += "\n" + device->reason;
            continue;
        }
        found = true;
        body(device->path);
    }
    if (!found)
        GTEST_SKIP() << "no devices here:" << reasons;
}

void expect_output_of(const std::string &device, const std::vector<std::string> &options,
                      const std::string &out, const std::string &err) {
    std::vector<std::string> words = {"oopslog"};
    words.insert(words.end(), options.begin(), options.end());
    words.push_back(device);
    RunResult result = run_fieldkit(words);
    EXPECT_EQ(0, result.exit_status);
    EXPECT_EQ(out, result.out);
    EXPECT_EQ(err, result.err);
}

void expect_output(const std::string &image, const std::vector<std::string> &options,
                   const std::string &out, const std::string &err) {
    with_each_device(
        image, [&](const std::string &device) { expect_output_of(device, options, out, err); });
}

TEST(OopslogDevices, AreOfEachKind) {
    // The tests below make do with what there is.
    std::string reasons;
    for (const DeviceKind &kind : DEVICE_KINDS) {
        TempDir dir;
        const std::unique_ptr<LogDevice> device = kind.make(dir, oops_page(1, "one\n"));
        if (device->path.empty())
            reasons += std::string("\nno ") + kind.name + ": " + device->reason;
    }
    if (!reasons.empty())
        GTEST_SKIP() << reasons;
}

const std::string FIVE_TO_SEVEN = oops_page(5, "five\n") + oops_page(6, "six\n") +
                                  oops_page(7, "seven\n") + erased_page() + erased_page();

TEST(OopslogOnEachDevice, TellsTheNewestEntryAndPrintsAllFromTheOldestOn) {
    expect_output(FIVE_TO_SEVEN, {},
                  "Log Entry 5 (at position 0)\nfive\n"
                  "Log Entry 6 (at position 1)\nsix\n"
                  "Log Entry 7 (at position 2)\nseven\n",
                  "Last log is at position 2 with count 7\n");
}

TEST(OopslogOnEachDevice, PrintsBackwardsFromTheSecondNewestAndTheNewestLast) {
    expect_output(FIVE_TO_SEVEN, {"-r"},
                  "Log Entry 6 (at position 1)\nsix\n"
                  "Log Entry 5 (at position 0)\nfive\n"
                  "Log Entry 7 (at position 2)\nseven\n",
                  "Last log is at position 2 with count 7\n");
}

TEST(OopslogOnEachDevice, GoesRoundTheEndOfTheDevice) {
    const std::string ring =
        oops_page(12, "c\n") + oops_page(13, "d\n") + oops_page(10, "a\n") + oops_page(11, "b\n");
    expect_output(ring, {},
                  "Log Entry 10 (at position 2)\na\nLog Entry 11 (at position 3)\nb\n"
                  "Log Entry 12 (at position 0)\nc\nLog Entry 13 (at position 1)\nd\n",
                  "Last log is at position 1 with count 13\n");
    expect_output(ring, {"-r"},
                  "Log Entry 12 (at position 0)\nc\nLog Entry 11 (at position 3)\nb\n"
                  "Log Entry 10 (at position 2)\na\nLog Entry 13 (at position 1)\nd\n",
                  "Last log is at position 1 with count 13\n");
}

TEST(OopslogOnEachDevice, TakesZeroBehindTheLastCountForNewerAndSignsCounts) {
    expect_output(erased_page() + oops_page(0x80000000, "a\n") + oops_page(0xfffffffd, "b\n") +
                      oops_page(0xfffffffe, "c\n") + oops_page(0, "d\n"),
                  {},
                  "Log Entry -2147483648 (at position 1)\na\n"
                  "Log Entry -3 (at position 2)\nb\n"
                  "Log Entry -2 (at position 3)\nc\n"
                  "Log Entry 0 (at position 4)\nd\n",
                  "Last log is at position 4 with count 0\n");
}

TEST(OopslogOnEachDevice, DoesNotTakeZeroBehindAnEarlierCountForNewer) {
    expect_output(oops_page(0xfffffffd, "a\n") + oops_page(0, "b\n"), {},
                  "Log Entry 0 (at position 1)\nb\nLog Entry -3 (at position 0)\na\n",
                  "Last log is at position 0 with count -3\n");
}

TEST(OopslogOnEachDevice, TakesTheEarlierOfEqualCountsForTheNewest) {
    expect_output(oops_page(5, "a\n") + oops_page(5, "b\n"), {},
                  "Log Entry 5 (at position 1)\nb\nLog Entry 5 (at position 0)\na\n",
                  "Last log is at position 0 with count 5\n");
}

TEST(OopslogOnEachDevice, NeitherCountsNorPrintsAPageWithAnotherMagic) {
    expect_output(oops_page(5, "a\n") + oops_page(6, "b\n", 0x5d005d01), {},
                  "Log Entry 5 (at position 0)\na\n", "Last log is at position 0 with count 5\n");
    expect_output(oops_page(6, "b\n", 0x005d005d), {}, "", "No logs present\n");
}

TEST(OopslogOnEachDevice, PrintsAWholePageOfTextAndNoByteOfAnother) {
    const std::string text(4088, 'x');
    expect_output(oops_page(1, text) + oops_page(2, text), {},
                  "Log Entry 1 (at position 0)\n" + text + "Log Entry 2 (at position 1)\n" + text,
                  "Last log is at position 1 with count 2\n");
}

TEST(OopslogOnEachDevice, PrintsControlCharactersAsDotsButNotNewlinesAndTabs) {
    expect_output(oops_page(1, std::string("a\0b\x1b[c\n\td\r\x7f\x80\xfe.", 14)), {},
                  "Log Entry 1 (at position 0)\na.b.[c\n\td\r....",
                  "Last log is at position 0 with count 1\n");
}

TEST(OopslogOnEachDevice, PrintsNoTextWhereFlashIsErasedRightBehindTheHeader) {
    expect_output(oops_page(1, ""), {}, "Log Entry 1 (at position 0)\n",
                  "Last log is at position 0 with count 1\n");
}

TEST(OopslogOnEachDevice, ReportsNoLogsOnErasedPages) {
    for (const std::vector<std::string> &options : {std::vector<std::string>{}, {"-r"}}) {
        expect_output(erased_page() + erased_page(), options, "", "No logs present\n");
        expect_output(std::string(8192, '\0'), options, "", "No logs present\n");
    }
}

TEST(OopslogOnEachDevice, ReportsNoLogsOnLessThanAPage) {
    expect_output(oops_page(1, "one\n").substr(0, 4095), {}, "", "No logs present\n");
    expect_output(oops_page(1, "one\n").substr(0, 512), {"-r"}, "", "No logs present\n");
}

TEST(OopslogOnEachDevice, FindsOnePageOn6000Bytes) {
    const std::string image = (oops_page(1, "one\n") + oops_page(2, "two\n")).substr(0, 6000);
    // The part of a page behind it is not looked at for the newest entry; only forwards the walk
    // goes over it.
    expect_output(image, {}, "Log Entry 2 (at position 1)\ntwo\n",
                  "Last log is at position 0 with count 1\n");
    expect_output(image, {"-r"}, "Log Entry 1 (at position 0)\none\n",
                  "Last log is at position 0 with count 1\n");
}

TEST(OopslogOnEachDevice, PrintsTheOnlyPageOfADevice) {
    for (const std::vector<std::string> &options : {std::vector<std::string>{}, {"-r"}}) {
        expect_output(oops_page(1, "one\n"), options, "Log Entry 1 (at position 0)\none\n",
                      "Last log is at position 0 with count 1\n");
    }
}

TEST(OopslogOnEachDevice, LooksAtNoArgumentBehindTheDevice) {
    with_each_device(FIVE_TO_SEVEN, [](const std::string &device) {
        RunResult result = run_fieldkit({"oopslog", device, "-r"});
        EXPECT_EQ("Log Entry 5", result.out.substr(0, 11));
        EXPECT_EQ(0, result.exit_status);
    });
}

TEST(OopslogOnEachDevice, SucceedsEvenWhenNobodyTakesTheEntries) {
    with_each_device(FIVE_TO_SEVEN, [](const std::string &device) {
        RunResult result = run_fieldkit(
            {"oopslog", device},
            {.before_exec = [] { dup2(open("/dev/full", O_WRONLY | O_CLOEXEC), STDOUT_FILENO); }});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("Last log is at position 2 with count 7\n", result.err);
    });
}

TEST(OopslogOnEachDevice, SurvivesRandomBytes) {
    std::mt19937 random(10);
    std::string image(64 * 4096, '\0');
    for (char &byte : image)
        byte = static_cast<char>(random());
    expect_output(image, {}, "", "No logs present\n");
    const std::string header("\x2a\0\0\0\0\x5d\0\x5d", 8);
    image.replace(20 * 4096, header.size() + 4, header + "abc\xff");
    expect_output(image, {"-r"}, "Log Entry 42 (at position 20)\nabc",
                  "Last log is at position 20 with count 42\n");
}

TEST(OopslogOnEachDevice, NamesTheQuestionForTheSizeWhenItFails) {
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    with_each_device(FIVE_TO_SEVEN, [&](const std::string &device) {
        const bool block = std::filesystem::is_block_file(device);
        const CallArgument question = {
            .index = 1, .value = static_cast<unsigned>(block ? BLKGETSIZE : MEMGETINFO)};
        RunResult result =
            run_fieldkit({"oopslog", device},
                         {.before_exec = [&] { (void)refuse_call(SYS_ioctl, EIO, question); }});
        EXPECT_EQ(1, result.exit_status);
        EXPECT_EQ("", result.out);
        EXPECT_EQ(block ? "BLKGETSIZE: Input/output error\n" : "MEMGETINFO: Input/output error\n",
                  result.err);
    });
}

TEST(OopslogOnEachDevice, ReadsAPageWhoseBlockIsNotSaidToBeGoodOrBad) {
    // The question does not exist for block devices, and fails on flash.
    if (!can_refuse_calls())
        GTEST_SKIP() << "no system-call filters here: " << strerror(errno);
    with_each_device(oops_page(1, "one\n"), [](const std::string &device) {
        RunResult result =
            run_fieldkit({"oopslog", device}, {.before_exec = [] {
                             (void)refuse_call(SYS_ioctl, EIO,
                                               CallArgument{.index = 1, .value = MEMGETBADBLOCK});
                         }});
        EXPECT_EQ(0, result.exit_status);
        EXPECT_EQ("Log Entry 1 (at position 0)\none\n", result.out);
    });
}

TEST(OopslogOnALoopDevice, ReportsNoLogsWhenItIsEmpty) {
    TempDir dir;
    const auto device = make_loop_device(dir.file("image", ""));
    if (device->path.empty())
        GTEST_SKIP() << device->reason;
    expect_output_of(device->path, {}, "", "No logs present\n");
}

TEST(OopslogOnALoopDevice, PrintsWhatIsLeftWhenItShrinks) {
    TempDir dir;
    std::string bytes(512 * 4096, '\xff');
    bytes.replace(0, 3 * 4096, FIVE_TO_SEVEN, 0, 3 * 4096);
    bytes.replace(511 * 4096, 4096, oops_page(8, "eight\n"));
    const std::string image = dir.file("image", bytes);
    const auto device = make_loop_device(image);
    if (device->path.empty())
        GTEST_SKIP() << device->reason;
    // The device keeps its size, with nothing behind it any more. Far from the entries that are
    // left: the kernel reads ahead, and may lose all that it reads at once.
    ASSERT_EQ(0, truncate(image.c_str(), 256 * 4096));
    expect_output_of(device->path, {},
                     "Log Entry 5 (at position 0)\nfive\n"
                     "Log Entry 6 (at position 1)\nsix\n"
                     "Log Entry 7 (at position 2)\nseven\n",
                     "Last log is at position 2 with count 7\n");
}

// A log whose pages 256 to 511 are going to be unreadable. The newest report in front of them fills
// its page, so that what is left of it in a buffer would be seen. Whole stretches of the log, as
// the kernel reads ahead, and may lose all that it reads at once.
const std::string LAST_WORDS(4088, 'x');
std::string failing_image(const std::string &behind) {
    std::string bytes(768 * 4096, '\xff');
    bytes.replace(0, 2 * 4096, oops_page(5, "five\n") + oops_page(6, LAST_WORDS));
    bytes.replace(256 * 4096, 4096, oops_page(9, "unreadable\n"));
    bytes.replace(511 * 4096, 4096, oops_page(10, "unreadable\n"));
    if (!behind.empty())
        bytes.replace(767 * 4096, 4096, behind);
    return bytes;
}

TEST(OopslogOnADeviceWithReadErrors, PrintsThePagesAroundThem) {
    TempDir dir;
    const std::string image = dir.file("image", failing_image(oops_page(7, "seven\n")));
    const auto device = make_failing_device(image, 256 * 4096, 512 * 4096);
    if (device->path.empty())
        GTEST_SKIP() << device->reason;
    ASSERT_TRUE(fails_to_read(device->path, 256 * 4096) && fails_to_read(device->path, 511 * 4096));
    expect_output_of(device->path, {},
                     "Log Entry 5 (at position 0)\nfive\nLog Entry 6 (at position 1)\n" +
                         LAST_WORDS + "Log Entry 7 (at position 767)\nseven\n",
                     "Last log is at position 767 with count 7\n");
    expect_output_of(
        device->path, {"-r"},
        "Log Entry 6 (at position 1)\n" + LAST_WORDS +
            "Log Entry 5 (at position 0)\nfive\nLog Entry 7 (at position 767)\nseven\n",
        "Last log is at position 767 with count 7\n");
}

TEST(OopslogOnADeviceWithReadErrors, ReportsNoLogsWhenNoPageCanBeRead) {
    TempDir dir;
    // Only the last page, an erased one, can.
    const auto device =
        make_failing_device(dir.file("image", failing_image(erased_page())), 512, 767 * 4096);
    if (device->path.empty())
        GTEST_SKIP() << device->reason;
    ASSERT_TRUE(fails_to_read(device->path, 1 * 4096));
    for (const std::vector<std::string> &options : {std::vector<std::string>{}, {"-r"}})
        expect_output_of(device->path, options, "", "No logs present\n");
}

TEST(OopslogOnADeviceWithReadErrors, EndsWithThemWhenTheBackOfTheDeviceIsLost) {
    TempDir dir;
    const std::string image = dir.file("image", failing_image(""));
    const auto device = make_loop_device(image);
    if (device->path.empty())
        GTEST_SKIP() << device->reason;
    ASSERT_EQ(0, truncate(image.c_str(), 256 * 4096));
    if (!fails_to_read(device->path, 256 * 4096))
        GTEST_SKIP() << "a loop device reads zeros behind the end of its file here";
    for (const std::vector<std::string> &options : {std::vector<std::string>{}, {"-r"}}) {
        expect_output_of(
            device->path, options,
            "Log Entry 5 (at position 0)\nfive\nLog Entry 6 (at position 1)\n" + LAST_WORDS,
            "Last log is at position 1 with count 6\n");
    }
}

TEST(OopslogOnNand, LeavesOutWhatLiesInABadBlock) {
    // Blocks of four pages; the entries of the bad one would be the newest.
    const std::string block =
        oops_page(4, "a\n") + oops_page(5, "b\n") + oops_page(6, "c\n") + oops_page(7, "d\n");
    const auto device = make_bad_nand_device(
        block + block + oops_page(1, "e\n") + oops_page(2, "f\n"),
        oops_page(8, "bad\n") + oops_page(9, "bad\n") + oops_page(10, "bad\n"));
    if (device->path.empty())
        GTEST_SKIP() << device->reason;
    expect_output_of(device->path, {},
                     "Log Entry 1 (at position 8)\ne\nLog Entry 2 (at position 9)\nf\n"
                     "Log Entry 4 (at position 0)\na\nLog Entry 5 (at position 1)\nb\n"
                     "Log Entry 6 (at position 2)\nc\nLog Entry 7 (at position 3)\nd\n",
                     "Last log is at position 3 with count 7\n");
    expect_output_of(device->path, {"-r"},
                     "Log Entry 6 (at position 2)\nc\nLog Entry 5 (at position 1)\nb\n"
                     "Log Entry 4 (at position 0)\na\nLog Entry 2 (at position 9)\nf\n"
                     "Log Entry 1 (at position 8)\ne\nLog Entry 7 (at position 3)\nd\n",
                     "Last log is at position 3 with count 7\n");
}

}  // namespace
