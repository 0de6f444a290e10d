// Records, the units of a resource trace: a header of 20 bytes and a payload.
//
// Each function that sends returns false when a write failed or memory was short: the stream is
// broken then, and whatever else were sent could not be told from the missing payload.
#pragma once

#include <stddef.h>
#include <stdint.h>
#include <sys/types.h>

#include <array>

#include "util/unique_fd.h"

// What a record carries. 5 is kept free for a variant that follows a single file.
constexpr uint32_t RECORD_IOSTAT = 1;
constexpr uint32_t RECORD_SMAPS = 2;      // the process's id in 4 bytes, then of its file
constexpr uint32_t RECORD_STATUS = 3;     // likewise
constexpr uint32_t RECORD_PROCESSES = 4;  // nothing: where the section about processes begins, ends
constexpr uint32_t RECORD_SMAPSTOT = 6;
constexpr uint32_t RECORD_FILENR = 7;
constexpr uint32_t RECORD_MEMINFO = 8;
constexpr uint32_t RECORD_DISKINFO = 9;  // the table of df_table.h
constexpr uint32_t RECORD_PAGETYPEINFO = 10;
constexpr uint32_t RECORD_MEDIAHUB = 11;
constexpr uint32_t RECORD_EVENT = 12;
constexpr uint32_t RECORD_PIDSTAT = 13;

// Of a header's flag. A data chunk of a file has MORE, the end record that follows the last one
// has LAST; a section of processes opens with MORE and closes with LAST.
constexpr uint32_t FLAG_LAST = 0;
constexpr uint32_t FLAG_MORE = 1;

constexpr size_t RECORD_HEADER_SIZE = 20;
constexpr size_t RECORD_PID_SIZE = 4;
// No payload is longer than this and a process id.
constexpr size_t RECORD_DATA_SIZE = 204800;

struct RecordStream {
    int fd;                      // borrowed
    bool sent = false;           // anything, since whoever wants to know has cleared it
    UniqueBlock<char> buffer{};  // see record_buffer
};

// Room for one payload, a process id included. The same at each call for a stream, and its own;
// null when memory is short.
char *record_buffer(RecordStream *stream);

// The header as it goes out, little-endian: type, length of the payload, the time in milliseconds
// since the beginning of 1970, flag.
std::array<uint8_t, RECORD_HEADER_SIZE> encode_record_header(uint32_t type, uint32_t length,
                                                             int64_t time_ms, uint32_t flag);

// Sends a header with the present time, in one write.
bool send_record_header(RecordStream *stream, uint32_t type, uint32_t length, uint32_t flag);

// Sends a record with `length` bytes of `payload`, at least one.
bool send_record(RecordStream *stream, uint32_t type, uint32_t flag, const char *payload,
                 size_t length);

// Sends the contents of the file `path` as records of `type` with at most RECORD_DATA_SIZE bytes of
// it each, and an end record behind them. In front of the bytes stands `pid`, unless it is
// negative. A file that is empty or cannot be opened, for its process may have ended, gives no
// record.
bool send_file_records(RecordStream *stream, uint32_t type, const char *path, pid_t pid);

// Does so with the file `suffix` ("/status") of every process, in the order of `proc_dir`
// ("/proc").
bool send_pid_files(RecordStream *stream, uint32_t type, const char *proc_dir, const char *suffix);
