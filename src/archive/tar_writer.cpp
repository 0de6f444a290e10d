#include "archive/tar_writer.h"

#include <inttypes.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <time.h>

#include <algorithm>

#include "util/stream.h"

namespace {

constexpr uint32_t BLOCK_SIZE = 512;

// A member's header, after the ustar format. Numbers are octal text.
struct TarHeader {
    char name[100];
    char mode[8];
    char uid[8];
    char gid[8];
    char size[12];
    char mtime[12];
    char chksum[8];
    char typeflag;
    char linkname[100];
    char magic[6];
    char version[2];
    char uname[32];
    char gname[32];
    char devmajor[8];
    char devminor[8];
    char prefix[155];
    char pad[12];
};
static_assert(sizeof(TarHeader) == BLOCK_SIZE);

// Copies as much of `text` as fits, without a terminator of its own.
template <size_t N>
void put(char (&field)[N], const char *text) {
    memcpy(field, text, std::min(N, strlen(text)));
}

// The prefix and the name, cut to the field: a longer name would need a header of another kind.
void put_name(char (&field)[100], const TarWriter *tw, const char *name) {
    size_t prefix_length = std::min<size_t>(sizeof field, tw->prefix_len);
    if (prefix_length > 0)
        memcpy(field, tw->prefix, prefix_length);
    memcpy(field + prefix_length, name, std::min(sizeof field - prefix_length, strlen(name)));
}

unsigned checksum(const TarHeader &header) {
    const unsigned char *bytes = reinterpret_cast<const unsigned char *>(&header);
    unsigned sum = 0;
    for (size_t i = 0; i < sizeof header; ++i)
        sum += bytes[i];
    return sum;
}

void fill_header(TarHeader *header, const TarWriter *tw, const char *name, int64_t size) {
    memset(header, 0, sizeof *header);
    put_name(header->name, tw, name);
    put(header->mode, "0000644");
    put(header->uid, "0000100");
    put(header->gid, "0000100");
    (void)snprintf(header->size, sizeof header->size, "%11.11" PRIo64, size);
    // Unsigned, so that a clock of 32 bits serves until 2106.
    (void)snprintf(header->mtime, sizeof header->mtime, "%11.11" PRIo32,
                   static_cast<uint32_t>(time(nullptr)));
    header->typeflag = '0';
    // The magic of POSIX with the version of old GNU tar: all readers take it, and archives of this
    // kind have always carried it.
    put(header->magic, "ustar");
    put(header->version, "  ");
    put(header->uname, "admin");
    put(header->gname, "admin");
    put(header->chksum, "        ");
    // The terminator takes the seventh byte; the eighth stays a blank.
    (void)snprintf(header->chksum, sizeof header->chksum - 1, "%6.6o", checksum(*header));
}

}  // namespace

TarWriter *tar_open(int fd, const char *prefix) {
    TarWriter *tw = static_cast<TarWriter *>(calloc(1, sizeof(TarWriter)));
    if (tw == nullptr)
        return nullptr;
    tw->fd = fd;
    if (prefix != nullptr && prefix[0] != '\0') {
        tw->prefix = strdup(prefix);
        if (tw->prefix == nullptr) {
            free(tw);
            return nullptr;
        }
        tw->prefix_len = static_cast<uint32_t>(strlen(prefix));
    }
    return tw;
}

void tar_close(TarWriter *tw) {
    tar_pad(tw->fd, &tw->member_bytes);
    tar_abandon(tw);
}

void tar_abandon(TarWriter *tw) {
    free(tw->prefix);
    free(tw);
}

void tar_header(TarWriter *tw, const char *name, int64_t size) {
    TarHeader header;
    fill_header(&header, tw, name, size);
    tar_pad(tw->fd, &tw->member_bytes);
    (void)write_all(tw->fd, &header, sizeof header);
    tw->member_bytes = 0;
}

int32_t tar_write(TarWriter *tw, const void *buf, uint32_t len) {
    int32_t result = write_all(tw->fd, buf, len);
    tw->member_bytes += len;
    return result;
}

void tar_account(TarWriter *tw, uint32_t n) {
    tw->member_bytes += n;
}

void tar_pad(int fd, uint32_t *count) {
    uint32_t used = *count % BLOCK_SIZE;
    if (used == 0)
        return;
    (void)write_zeros(fd, BLOCK_SIZE - used);
    *count += BLOCK_SIZE - used;
}

int write_zeros(int fd, int64_t n) {
    // As much as any padding takes, so that a small member costs one write for it.
    constexpr char ZEROS[BLOCK_SIZE] = {};
    while (n > 0) {
        uint32_t piece = static_cast<uint32_t>(std::min<int64_t>(n, sizeof ZEROS));
        if (write_all(fd, ZEROS, piece) < 0)
            return 1;
        n -= piece;
    }
    return 0;
}
