#include "rtrace/record_stream.h"

#include <ctype.h>
#include <dirent.h>
#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <time.h>
#include <unistd.h>

#include "util/stream.h"

namespace {

constexpr size_t PATH_SIZE = 200;

// The device and its readers are little-endian; other hosts must write the same bytes.
uint8_t *put_le32(uint8_t *at, uint32_t value) {
    for (int i = 0; i < 4; ++i, value >>= 8)
        *at++ = static_cast<uint8_t>(value & 0xff);
    return at;
}

int64_t wall_clock_ms() {
    timespec now = {};
    (void)clock_gettime(CLOCK_REALTIME, &now);  // which cannot fail
    return static_cast<int64_t>(now.tv_sec) * 1000 + now.tv_nsec / 1000000;
}

bool send_bytes(RecordStream *stream, const void *bytes, size_t length) {
    stream->sent = true;
    const uint32_t size = static_cast<uint32_t>(length);
    return write_all(stream->fd, bytes, size) == static_cast<int32_t>(size);
}

// Whether `entry` is the directory of a process.
bool is_process(const dirent *entry) {
    if (entry->d_type != DT_DIR)
        return false;
    for (const char *c = entry->d_name; *c != '\0'; ++c) {
        if (isdigit(static_cast<unsigned char>(*c)) == 0)
            return false;
    }
    return true;
}

}  // namespace

char *record_buffer(RecordStream *stream) {
    if (stream->buffer == nullptr)
        stream->buffer.reset(static_cast<char *>(malloc(RECORD_PID_SIZE + RECORD_DATA_SIZE)));
    return stream->buffer.get();
}

std::array<uint8_t, RECORD_HEADER_SIZE> encode_record_header(uint32_t type, uint32_t length,
                                                             int64_t time_ms, uint32_t flag) {
    const uint64_t time = static_cast<uint64_t>(time_ms);
    std::array<uint8_t, RECORD_HEADER_SIZE> header;
    uint8_t *at = put_le32(header.data(), type);
    at = put_le32(at, length);
    at = put_le32(at, static_cast<uint32_t>(time & 0xffffffff));
    at = put_le32(at, static_cast<uint32_t>(time >> 32));
    (void)put_le32(at, flag);
    return header;
}

bool send_record_header(RecordStream *stream, uint32_t type, uint32_t length, uint32_t flag) {
    const auto header = encode_record_header(type, length, wall_clock_ms(), flag);
    return send_bytes(stream, header.data(), header.size());
}

bool send_record(RecordStream *stream, uint32_t type, uint32_t flag, const char *payload,
                 size_t length) {
    return send_record_header(stream, type, static_cast<uint32_t>(length), flag) &&
           send_bytes(stream, payload, length);
}

bool send_file_records(RecordStream *stream, uint32_t type, const char *path, pid_t pid) {
    char *payload = record_buffer(stream);
    if (payload == nullptr)
        return false;
    const UniqueFd file(open(path, O_RDONLY | O_CLOEXEC));
    if (!file.valid())
        return true;
    char *data = payload;
    if (pid >= 0)
        data += RECORD_PID_SIZE;

    bool any = false;
    ssize_t n;
    // An error ends a file like its end: that of a process which has ended meanwhile.
    while ((n = read(file.get(), data, RECORD_DATA_SIZE)) > 0) {
        any = true;
        if (pid >= 0)
            (void)put_le32(reinterpret_cast<uint8_t *>(payload), static_cast<uint32_t>(pid));
        const size_t length = static_cast<size_t>(data - payload) + static_cast<size_t>(n);
        if (!send_record(stream, type, FLAG_MORE, payload, length))
            return false;
    }
    return !any || send_record_header(stream, type, 0, FLAG_LAST);
}

bool send_pid_files(RecordStream *stream, uint32_t type, const char *proc_dir, const char *suffix) {
    const UniqueDir dir(opendir(proc_dir));
    if (dir == nullptr)
        return true;
    while (const dirent *entry = readdir(dir.get())) {
        if (!is_process(entry))
            continue;
        const pid_t pid = static_cast<pid_t>(strtol(entry->d_name, nullptr, 10));
        char path[PATH_SIZE];
        (void)snprintf(path, sizeof path, "%s/%d%s", proc_dir, pid, suffix);
        if (!send_file_records(stream, type, path, pid))
            return false;
    }
    return true;
}
