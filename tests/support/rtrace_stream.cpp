#include "support/rtrace_stream.h"

#include <errno.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

namespace {

constexpr size_t HEADER_SIZE = 20;

uint64_t little_endian(std::string_view bytes) {
    uint64_t value = 0;
    for (size_t i = bytes.size(); i-- > 0;)
        value = value << 8 | static_cast<unsigned char>(bytes[i]);
    return value;
}

RtraceTestRecord parse_header(std::string_view header) {
    RtraceTestRecord record;
    record.type = static_cast<uint32_t>(little_endian(header.substr(0, 4)));
    record.length = static_cast<uint32_t>(little_endian(header.substr(4, 4)));
    record.time_ms = static_cast<int64_t>(little_endian(header.substr(8, 8)));
    record.flag = static_cast<uint32_t>(little_endian(header.substr(16, 4)));
    return record;
}

// Exactly `size` bytes, or less when the stream ends or stalls.
std::string receive(int fd, size_t size, int timeout_s) {
    std::string bytes(size, '\0');
    size_t done = 0;
    while (done < size) {
        pollfd waited = {fd, POLLIN, 0};
        int ready = poll(&waited, 1, timeout_s * 1000);
        if (ready == 0)
            break;
        ssize_t n = ready > 0 ? read(fd, &bytes[done], size - done) : -1;
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            break;
        done += static_cast<size_t>(n);
    }
    bytes.resize(done);
    return bytes;
}

}  // namespace

RtraceTestStream parse_rtrace(std::string_view stream) {
    RtraceTestStream result;
    while (stream.size() >= HEADER_SIZE) {
        RtraceTestRecord record = parse_header(stream);
        if (stream.size() - HEADER_SIZE < record.length)
            break;
        record.payload = stream.substr(HEADER_SIZE, record.length);
        stream.remove_prefix(HEADER_SIZE + record.length);
        result.records.push_back(record);
    }
    result.rest = stream;
    return result;
}

std::string brief(const RtraceTestRecord &record) {
    return std::to_string(record.type) + "/" + std::to_string(record.flag) + "/" +
           std::to_string(record.length);
}

std::string brief(const std::vector<RtraceTestRecord> &records) {
    std::string text;
    for (const RtraceTestRecord &record : records)
        text += brief(record) + " ";
    return text;
}

RtraceTestRecord receive_rtrace_record(int fd, int timeout_s) {
    std::string header = receive(fd, HEADER_SIZE, timeout_s);
    if (header.size() < HEADER_SIZE) {
        ADD_FAILURE() << "no further record, only " << header.size() << " bytes";
        return {};
    }
    RtraceTestRecord record = parse_header(header);
    record.payload = receive(fd, record.length, timeout_s);
    if (record.payload.size() < record.length) {
        ADD_FAILURE() << brief(record) << " ends after " << record.payload.size() << " bytes";
        return {};
    }
    return record;
}
