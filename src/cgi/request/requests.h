// The requests that a thread of its own serves.
//
// Each routine is the start routine of a thread: it takes over its record, which was made with
// calloc or malloc, detaches itself, writes the whole reply to the record's client, and closes and
// frees what it was given. A null record ends the program.
#pragma once

#include <pthread.h>
#include <stdint.h>
#include <sys/types.h>

#include <atomic>

#include "cgi/request_values.h"

struct ArchiveRequest {
    int32_t client_fd;
    uint32_t gzip;  // 1: compressed
};

struct PcapRequest {
    int32_t client_fd;
    int32_t duration;   // seconds; 0: no limit
    int32_t totalsize;  // bytes; 0: no limit
};

struct RtraceRequest {
    int32_t client_fd;
    int32_t interval;  // seconds
    uint32_t items;    // see rtrace/trace_items.h
};

struct StraceRequest {
    pid_t pids[MAX_TRACED];
    uint32_t nr_pids;
    int32_t client_fd;
    std::atomic<uint32_t> running;  // 1; cleared when the trace has ended or is to end
    std::atomic<uint32_t> traced;   // 0; set when the trace has ended
    pthread_t tracer_thread;        // filled in by the thread itself
    uint32_t stuck;                 // 0; its own: set when the client takes nothing any more
};

// 1 while an archive is made: there is one at a time. Set by the dispatcher, cleared by the thread
// that made it.
extern std::atomic<uint32_t> archive_busy;

void *run_archive_request(void *archive_request);
void *run_pcap_request(void *pcap_request);
void *run_rtrace_request(void *rtrace_request);
void *run_strace_request(void *strace_request);

// Its argument is the client descriptor itself.
void *run_ps_request(void *client_fd);
