#include "rtrace/record_stream.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/socket.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <functional>
#include <string>
#include <vector>

#include "support/failed_writes.h"
#include "support/rtrace_stream.h"
#include "support/temp_dir.h"

namespace {

std::string bytes_of(const std::array<uint8_t, 20> &header) {
    return std::string(header.begin(), header.end());
}

// What `send` writes to its stream, and what it returns.
struct Sent {
    bool result = false;
    std::string bytes;
    std::vector<RtraceTestRecord> records;
};

Sent sent_by(const std::function<bool(RecordStream *)> &send) {
    TempDir dir;
    dir.file("stream", "");
    RecordStream stream = {.fd = open((dir / "stream").c_str(), O_WRONLY | O_CLOEXEC)};
    EXPECT_GE(stream.fd, 0);
    Sent sent;
    sent.result = send(&stream);
    close(stream.fd);
    sent.bytes = read_whole_file(dir / "stream");
    RtraceTestStream parsed = parse_rtrace(sent.bytes);
    EXPECT_TRUE(!sent.result || parsed.rest.empty());
    sent.records = parsed.records;
    return sent;
}

Sent sent_of_file(const std::string &path, pid_t pid = -1) {
    return sent_by(
        [&](RecordStream *stream) { return send_file_records(stream, 8, path.c_str(), pid); });
}

// What goes out of `send`, write by write.
std::vector<std::string> writes_of(const std::function<bool(RecordStream *)> &send) {
    int ends[2];
    EXPECT_EQ(0, socketpair(AF_UNIX, SOCK_SEQPACKET, 0, ends));
    RecordStream stream = {.fd = ends[0]};
    EXPECT_TRUE(send(&stream));
    close(ends[0]);
    std::vector<std::string> writes;
    char block[65536];
    ssize_t n;
    while ((n = read(ends[1], block, sizeof block)) > 0)
        writes.emplace_back(block, static_cast<size_t>(n));
    close(ends[1]);
    return writes;
}

// A stream whose reader has gone.
class BrokenStream {
  public:
    BrokenStream() {
        signal(SIGPIPE, SIG_IGN);
        int ends[2];
        EXPECT_EQ(0, pipe2(ends, O_CLOEXEC));
        close(ends[0]);
        stream.fd = ends[1];
    }
    ~BrokenStream() { close(stream.fd); }
    RecordStream stream = {.fd = -1};
};

std::string varied(size_t size) {
    std::string text(size, '\0');
    for (size_t i = 0; i < size; ++i)
        text[i] = static_cast<char>(i * 7 + i / 251);
    return text;
}

TEST(RecordHeader, IsLittleEndianWithTheLowWordOfTheTimeFirst) {
    const unsigned char expected[] = {13,   0,    0,    0,     // type
                                      0x04, 0x20, 0x03, 0,     // length 204804
                                      0x08, 0x07, 0x06, 0x05,  // time
                                      0x04, 0x03, 0x02, 0x01,  //
                                      1,    0,    0,    0};    // flag
    EXPECT_EQ(std::string(reinterpret_cast<const char *>(expected), sizeof expected),
              bytes_of(encode_record_header(13, 204804, 0x0102030405060708, 1)));
}

TEST(RecordHeader, TakesATimeBefore1970AsItIs) {
    EXPECT_EQ(std::string("\4\0\0\0\0\0\0\0\xff\xff\xff\xff\xff\xff\xff\xff\0\0\0\0", 20),
              bytes_of(encode_record_header(4, 0, -1, 0)));
}

TEST(SendRecordHeader, HasTheTimeInMilliseconds) {
    const auto clock_ms = [] {
        timespec now;
        clock_gettime(CLOCK_REALTIME, &now);
        return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
    };
    const int64_t before = clock_ms();
    const Sent sent =
        sent_by([](RecordStream *stream) { return send_record_header(stream, 4, 0, 1); });
    const int64_t after = clock_ms();
    EXPECT_TRUE(sent.result);
    ASSERT_EQ("4/1/0 ", brief(sent.records));
    EXPECT_LE(before, sent.records[0].time_ms);
    EXPECT_GE(after, sent.records[0].time_ms);
}

TEST(SendRecordHeader, FailsWhenTheReaderHasGone) {
    BrokenStream broken;
    EXPECT_FALSE(send_record_header(&broken.stream, 4, 0, 1));
}

TEST(SendRecord, WritesTheHeaderAtOnceAndThePayloadBehindIt) {
    const std::vector<std::string> writes = writes_of(
        [](RecordStream *stream) { return send_record(stream, 11, FLAG_LAST, "payload", 7); });
    ASSERT_EQ(2U, writes.size());
    ASSERT_EQ(20U, writes[0].size());
    EXPECT_EQ(std::string("\13\0\0\0\7\0\0\0", 8), writes[0].substr(0, 8));
    EXPECT_EQ(std::string("\0\0\0\0", 4), writes[0].substr(16));
    EXPECT_EQ("payload", writes[1]);
}

TEST(SendFileRecords, SendsAFileAndAnEndRecord) {
    TempDir dir;
    const Sent sent = sent_of_file(dir.file("meminfo", "MemTotal: 1 kB\n"));
    EXPECT_TRUE(sent.result);
    ASSERT_EQ("8/1/15 8/0/0 ", brief(sent.records));
    EXPECT_EQ("MemTotal: 1 kB\n", sent.records[0].payload);
    EXPECT_EQ(55U, sent.bytes.size());
}

TEST(SendFileRecords, PutsTheProcessIdInFrontOfDataAlone) {
    TempDir dir;
    const Sent sent = sent_of_file(dir.file("status", "Name:\tinit\n"), 0x01020304);
    EXPECT_TRUE(sent.result);
    ASSERT_EQ("8/1/15 8/0/0 ", brief(sent.records));
    EXPECT_EQ("\4\3\2\1Name:\tinit\n", sent.records[0].payload);
}

TEST(SendFileRecords, TakesProcessZeroForAProcess) {
    TempDir dir;
    const Sent sent = sent_of_file(dir.file("status", "x"), 0);
    ASSERT_EQ("8/1/5 8/0/0 ", brief(sent.records));
    EXPECT_EQ(std::string("\0\0\0\0x", 5), sent.records[0].payload);
}

TEST(SendFileRecords, ASingleFullChunkGivesOneDataRecordAndAnEndRecord) {
    TempDir dir;
    const std::string text = varied(204800);
    const Sent sent = sent_of_file(dir.file("file", text));
    EXPECT_TRUE(sent.result);
    ASSERT_EQ("8/1/204800 8/0/0 ", brief(sent.records));
    EXPECT_EQ(text, sent.records[0].payload);
}

TEST(SendFileRecords, ALongerFileGoesOnInFurtherChunksEachWithTheProcessId) {
    TempDir dir;
    const std::string text = varied(409601);
    const std::string path = dir.file("file", text);
    const Sent plain = sent_of_file(path);
    ASSERT_EQ("8/1/204800 8/1/204800 8/1/1 8/0/0 ", brief(plain.records));
    EXPECT_EQ(text, plain.records[0].payload + plain.records[1].payload + plain.records[2].payload);

    const Sent of_process = sent_of_file(path, 9);
    ASSERT_EQ("8/1/204804 8/1/204804 8/1/5 8/0/0 ", brief(of_process.records));
    std::string together;
    for (size_t i = 0; i < 3; ++i) {
        EXPECT_EQ(std::string("\11\0\0\0", 4), of_process.records[i].payload.substr(0, 4));
        together += of_process.records[i].payload.substr(4);
    }
    EXPECT_EQ(text, together);
}

TEST(SendFileRecords, AnEmptyFileGivesNothing) {
    TempDir dir;
    const Sent sent = sent_of_file(dir.file("file", ""), 12);
    EXPECT_TRUE(sent.result);
    EXPECT_EQ("", sent.bytes);
}

TEST(SendFileRecords, AMissingFileIsNoErrorAndGivesNothing) {
    TempDir dir;
    const Sent sent = sent_of_file(dir / "smapstot");
    EXPECT_TRUE(sent.result);
    EXPECT_EQ("", sent.bytes);
}

TEST(SendFileRecords, WhatCannotBeReadGivesNothing) {
    TempDir dir;
    const Sent sent = sent_of_file(dir.path());
    EXPECT_TRUE(sent.result);
    EXPECT_EQ("", sent.bytes);
}

TEST(SendFileRecords, FailsWhenTheReaderHasGone) {
    TempDir dir;
    BrokenStream broken;
    EXPECT_FALSE(send_file_records(&broken.stream, 8, dir.file("file", "x").c_str(), -1));
    EXPECT_FALSE(send_file_records(&broken.stream, 8, dir.file("file", "x").c_str(), 1));
    EXPECT_TRUE(send_file_records(&broken.stream, 8, dir.file("empty", "").c_str(), 1))
        << "nothing was to be written";
}

TEST(SendFileRecords, FailsAtWhicheverByteTheStreamBreaks) {
    signal(SIGXFSZ, SIG_IGN);
    TempDir dir;
    const std::string path = dir.file("file", "x");
    rlimit unlimited;
    ASSERT_EQ(0, getrlimit(RLIMIT_FSIZE, &unlimited));
    for (rlim_t room = 0; room <= 45; ++room) {
        const Sent sent = sent_by([&](RecordStream *stream) {
            const rlimit limit = {room, unlimited.rlim_max};
            EXPECT_EQ(0, setrlimit(RLIMIT_FSIZE, &limit));
            const bool result = send_file_records(stream, 8, path.c_str(), 1);
            EXPECT_EQ(0, setrlimit(RLIMIT_FSIZE, &unlimited));
            return result;
        });
        EXPECT_EQ(room == 45, sent.result) << room;
        EXPECT_EQ(room, sent.bytes.size());
    }
}

TEST(SendPidFiles, SendsTheFileOfEachDirectoryNamedByDigitsInTheirOrder) {
    TempDir proc;
    for (const char *name : {"1/status", "20/status", "self/status", "1a/status", "a1/status",
                             "-3/status", "4.5/status"})
        proc.file(name, name);
    proc.file("300", "a file");
    ASSERT_EQ(0, symlink("1", (proc / "400").c_str()));
    proc.file("77/other", "no status here");
    proc.file("88/status", "");
    const Sent sent = sent_by([&](RecordStream *stream) {
        return send_pid_files(stream, 3, proc.path().c_str(), "/status");
    });
    EXPECT_TRUE(sent.result);
    ASSERT_EQ(4U, sent.records.size());
    std::vector<std::string> found = {sent.records[0].payload, sent.records[2].payload};
    std::sort(found.begin(), found.end());
    EXPECT_EQ(std::string("\1\0\0\0001/status", 12), found[0]);
    EXPECT_EQ(std::string("\24\0\0\00020/status", 13), found[1]);
    for (size_t i : {0, 2}) {
        EXPECT_EQ(3U, sent.records[i].type);
        EXPECT_EQ(1U, sent.records[i].flag);
        EXPECT_EQ("3/0/0", brief(sent.records[i + 1]));
    }
}

TEST(SendPidFiles, StopsAtTheFirstFailure) {
    TempDir proc;
    proc.file("1/status", "x");
    proc.file("2/status", "x");
    BrokenStream broken;
    EXPECT_EQ(1, failed_writes([&] {
                  EXPECT_FALSE(send_pid_files(&broken.stream, 3, proc.path().c_str(), "/status"));
              }));
}

TEST(SendPidFiles, WithoutAnyProcessThereIsNothingToFail) {
    TempDir proc;
    BrokenStream broken;
    EXPECT_TRUE(send_pid_files(&broken.stream, 3, proc.path().c_str(), "/status"));
    EXPECT_TRUE(send_pid_files(&broken.stream, 3, (proc / "none").c_str(), "/status"));
}

}  // namespace
