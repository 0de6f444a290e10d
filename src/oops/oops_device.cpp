// Access to the device of the oops log.
#include "oops/oops_device.h"

#include <fcntl.h>
#include <linux/fs.h>
#include <mtd/mtd-user.h>
#include <stdio.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <utility>

#include "oops/log_page.h"

namespace {

bool is_bad_block(void *context, uint64_t offset) {
    const OopsDevice *device = static_cast<OopsDevice *>(context);
    loff_t block = static_cast<loff_t>(offset);
    // An error is no answer: flash that cannot have bad blocks may refuse the question.
    return ioctl(device->fd.get(), MEMGETBADBLOCK, &block) > 0;
}

void read_page(void *context, uint64_t offset, uint8_t *buf) {
    const OopsDevice *device = static_cast<OopsDevice *>(context);
    // Not checked: the caller's buffer is one of erased flash where nothing came.
    (void)!pread(device->fd.get(), buf, LOG_PAGE_SIZE, static_cast<off_t>(offset));
}

bool ask_block_device_size(int fd, uint64_t *size) {
    unsigned long sectors = 0;
    if (ioctl(fd, BLKGETSIZE, &sectors) != 0) {
        perror("BLKGETSIZE");
        return false;
    }
    *size = block_device_size(sectors);
    return true;
}

bool ask_flash_size(int fd, uint64_t *size) {
    mtd_info_user info = {};
    if (ioctl(fd, MEMGETINFO, &info) != 0) {
        perror("MEMGETINFO");
        return false;
    }
    *size = info.size;
    return true;
}

}  // namespace

bool open_oops_device(const char *path, OopsDevice *device) {
    UniqueFd fd(open(path, O_RDONLY | O_CLOEXEC));
    if (!fd.valid()) {
        perror("open");
        return false;
    }
    struct stat status;
    if (fstat(fd.get(), &status) != 0) {
        perror("stat");
        return false;
    }
    device->fd = std::move(fd);
    device->is_block_device = S_ISBLK(status.st_mode);
    return device->is_block_device ? ask_block_device_size(device->fd.get(), &device->size)
                                   : ask_flash_size(device->fd.get(), &device->size);
}

LogSource log_source(OopsDevice *device) {
    return {.size = device->size,
            .is_bad_block = device->is_block_device ? nullptr : is_bad_block,
            .read_page = read_page,
            .context = device};
}
