// Takes the stream of a resource trace apart, independently of the code that writes it.
#pragma once

#include <stdint.h>

#include <string>
#include <string_view>
#include <vector>

struct RtraceTestRecord {
    uint32_t type = 0;
    uint32_t length = 0;
    int64_t time_ms = 0;
    uint32_t flag = 0;
    std::string payload;
};

struct RtraceTestStream {
    std::vector<RtraceTestRecord> records;  // the whole ones
    std::string rest;                       // what follows the last whole one
};

RtraceTestStream parse_rtrace(std::string_view stream);

// "TYPE/FLAG/LENGTH" of a record.
std::string brief(const RtraceTestRecord &record);

// Those of all records, with a blank after each.
std::string brief(const std::vector<RtraceTestRecord> &records);

// The next record that arrives at `fd`, a stream. Fails the test, and gives one of type 0, when the
// stream ends before, or nothing comes for `timeout_s`.
RtraceTestRecord receive_rtrace_record(int fd, int timeout_s = 30);
