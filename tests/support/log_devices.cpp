#include "support/log_devices.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/blkpg.h>
#include <linux/dm-ioctl.h>
#include <linux/loop.h>
#include <mtd/mtd-user.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/file.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <utility>
#include <vector>

#include "support/run_program.h"
#include "util/unique_fd.h"

namespace {

std::string error_of(const std::string &call) {
    return call + ": " + strerror(errno);
}

// Where the tests may: on the emulated board.
bool load_module(const std::string &words) {
    return getenv("FIELDKIT_LOAD_MODULES") != nullptr &&
           run_program({"/bin/sh", "-c", "PATH=$PATH:/sbin:/usr/sbin; modprobe " + words})
                   .exit_status == 0;
}

// ---- Loop devices

struct LoopDevice : LogDevice {
    UniqueFd fd;
};

// Takes the loop device `number` for `file`. Returns false with errno set.
bool take_loop_device(const std::string &path, int file, UniqueFd *ret) {
    UniqueFd fd(open(path.c_str(), O_RDWR | O_CLOEXEC));
    if (!fd.valid() || ioctl(fd.get(), LOOP_SET_FD, file) != 0)
        return false;
    // From now on it is free again once nobody has it open, however the test ends.
    loop_info64 info = {};
    info.lo_flags = LO_FLAGS_AUTOCLEAR;
    if (ioctl(fd.get(), LOOP_SET_STATUS64, &info) != 0) {
        const int error = errno;
        ioctl(fd.get(), LOOP_CLR_FD, 0);
        errno = error;
        return false;
    }
    *ret = std::move(fd);
    return true;
}

// ---- Devices of the device mapper

constexpr const char *MAPPER = "/dev/mapper/control";
constexpr uint64_t SECTOR = 512;

struct MappedDevice : LogDevice {
    ~MappedDevice() override;
    std::unique_ptr<LogDevice> below;
    UniqueFd control;
    std::string name;  // empty until the device exists
};

// One piece of a mapped device, in sectors.
struct MapperTarget {
    uint64_t begin;
    uint64_t end;
    const char *type;
    std::string parameters;
};

// Puts `request` to the device mapper about the device `name`; `targets` is its new table, where
// the request loads one. Returns the number of the device, or -1 with errno set.
int64_t ask_mapper(int control, unsigned long request, const std::string &name,
                   const std::vector<MapperTarget> &targets = {}) {
    std::string table;
    for (const MapperTarget &target : targets) {
        std::string parameters = target.parameters + '\0';
        parameters.resize((parameters.size() + 7) / 8 * 8);
        dm_target_spec spec = {};
        spec.sector_start = target.begin;
        spec.length = target.end - target.begin;
        spec.next = static_cast<uint32_t>(sizeof(spec) + parameters.size());
        strcpy(spec.target_type, target.type);
        table += std::string(reinterpret_cast<const char *>(&spec), sizeof(spec)) + parameters;
    }
    dm_ioctl head = {};
    head.version[0] = 4;  // as it has been since Linux 2.6
    head.data_start = sizeof(head);
    head.target_count = static_cast<uint32_t>(targets.size());
    strcpy(head.name, name.c_str());
    std::string block(reinterpret_cast<const char *>(&head), sizeof(head));
    block += table;
    head.data_size = static_cast<uint32_t>(block.size());
    memcpy(block.data(), &head, sizeof(head));
    if (ioctl(control, request, block.data()) != 0)
        return -1;
    memcpy(&head, block.data(), sizeof(head));
    return static_cast<int64_t>(head.dev);
}

MappedDevice::~MappedDevice() {
    if (!name.empty() && ask_mapper(control.get(), DM_DEV_REMOVE, name) < 0)
        ADD_FAILURE() << error_of("DM_DEV_REMOVE");
}

// ---- Flash

// The number of the flash device of this name, or -1.
int find_flash(const std::string &name) {
    FILE *table = fopen("/proc/mtd", "re");
    int found = -1;
    char line[256];
    while (table != nullptr && fgets(line, sizeof(line), table) != nullptr) {
        int number = -1;
        if (sscanf(line, "mtd%d:", &number) == 1 &&
            strstr(line, ("\"" + name + "\"").c_str()) != nullptr)
            found = number;
    }
    if (table != nullptr)
        fclose(table);
    return found;
}

std::string flash_path(int number) {
    return "/dev/mtd" + std::to_string(number);
}

// Opens the flash device `name`, which `module` makes, once nobody else uses it. Returns its
// number, or -1 with the reason.
int open_flash(const std::string &name, const std::string &module, UniqueFd *fd,
               std::string *reason) {
    int number = find_flash(name);
    if (number < 0 && load_module(module))
        wait_until([&] { return (number = find_flash(name)) >= 0; });
    if (number < 0) {
        if (getenv("FIELDKIT_LOAD_MODULES") != nullptr)
            ADD_FAILURE() << "modprobe " << module << " made no flash";
        *reason = "this machine has no flash \"" + name + "\"";
        return -1;
    }
    const std::string path = flash_path(number);
    wait_until([&] { return access(path.c_str(), F_OK) == 0; });
    fd->reset(open(path.c_str(), O_RDWR | O_CLOEXEC));
    if (fd->valid() && flock(fd->get(), LOCK_EX) == 0)
        return number;
    *reason = error_of(path);
    return -1;
}

bool erase_flash(int fd) {
    mtd_info_user info = {};
    if (ioctl(fd, MEMGETINFO, &info) != 0)
        return false;
    for (uint32_t at = 0; at < info.size; at += info.erasesize) {
        loff_t block = at;
        if (ioctl(fd, MEMGETBADBLOCK, &block) > 0)
            continue;
        erase_info_user part = {.start = at, .length = info.erasesize};
        if (ioctl(fd, MEMERASE, &part) != 0)
            return false;
    }
    return true;
}

bool write_flash(int fd, const std::string &bytes, off_t offset) {
    return bytes.empty() ||
           pwrite(fd, bytes.data(), bytes.size(), offset) == static_cast<ssize_t>(bytes.size());
}

bool change_partition(int fd, int operation, const blkpg_partition &partition) {
    blkpg_partition copy = partition;
    blkpg_ioctl_arg argument = {
        .op = operation, .flags = 0, .datalen = sizeof(copy), .data = &copy};
    return ioctl(fd, BLKPG, &argument) == 0;
}

struct FlashDevice : LogDevice {
    ~FlashDevice() override {
        if (partition.pno >= 0)
            change_partition(fd.get(), BLKPG_DEL_PARTITION, partition);
    }
    UniqueFd fd;  // of the whole flash, locked
    blkpg_partition partition = {.start = 0, .length = 0, .pno = -1, .devname = {}, .volname = {}};
};

struct NandDevice : LogDevice {
    UniqueFd fd;
};

}  // namespace

std::unique_ptr<LogDevice> make_loop_device(const std::string &file) {
    auto device = std::make_unique<LoopDevice>();
    const UniqueFd image(open(file.c_str(), O_RDWR | O_CLOEXEC));
    if (access("/dev/loop-control", F_OK) != 0)
        load_module("loop");
    const UniqueFd control(open("/dev/loop-control", O_RDWR | O_CLOEXEC));
    if (!control.valid()) {
        device->reason = error_of("/dev/loop-control");
        return device;
    }
    std::string path;
    // Others may take the device between the question and its use.
    const bool taken = wait_until(
        [&] {
            const int number = ioctl(control.get(), LOOP_CTL_GET_FREE);
            path = "/dev/loop" + std::to_string(number);
            return number < 0 || take_loop_device(path, image.get(), &device->fd) || errno != EBUSY;
        },
        10);
    if (taken && device->fd.valid())
        device->path = path;
    else
        device->reason = error_of(path);
    return device;
}

std::unique_ptr<LogDevice> make_failing_device(const std::string &file, off_t begin, off_t end) {
    auto device = std::make_unique<MappedDevice>();
    device->control.reset(open(MAPPER, O_RDWR | O_CLOEXEC));
    if (!device->control.valid() && load_module("dm-mod"))
        device->control.reset(open(MAPPER, O_RDWR | O_CLOEXEC));
    if (!device->control.valid()) {
        device->reason = error_of(MAPPER);
        if (getenv("FIELDKIT_LOAD_MODULES") != nullptr)
            ADD_FAILURE() << device->reason;
        return device;
    }
    device->below = make_loop_device(file);
    struct stat status;
    if (device->below->path.empty() || stat(file.c_str(), &status) != 0) {
        device->reason = device->below->reason;
        return device;
    }
    const std::string &below = device->below->path;
    const uint64_t from = static_cast<uint64_t>(begin) / SECTOR;
    const uint64_t to = static_cast<uint64_t>(end) / SECTOR;
    const std::vector<MapperTarget> table = {{0, from, "linear", below + " 0"},
                                             {from, to, "error", ""},
                                             {to, static_cast<uint64_t>(status.st_size) / SECTOR,
                                              "linear", below + " " + std::to_string(to)}};
    const std::string name = "oopslog-test-" + std::to_string(getpid());
    const int control = device->control.get();
    if (ask_mapper(control, DM_DEV_CREATE, name) < 0) {
        device->reason = error_of("DM_DEV_CREATE");
        return device;
    }
    device->name = name;
    // To suspend without asking to is to resume, which puts the new table in force.
    int64_t number = ask_mapper(control, DM_TABLE_LOAD, name, table);
    if (number >= 0)
        number = ask_mapper(control, DM_DEV_SUSPEND, name);
    const std::string path = "/dev/dm-" + std::to_string(minor(static_cast<dev_t>(number)));
    if (number >= 0 && wait_until([&] { return access(path.c_str(), F_OK) == 0; }))
        device->path = path;
    else
        ADD_FAILURE() << error_of("device mapper");
    return device;
}

bool fails_to_read(const std::string &device, off_t offset) {
    const UniqueFd fd(open(device.c_str(), O_RDONLY | O_CLOEXEC));
    char sector[SECTOR];
    return pread(fd.get(), sector, sizeof(sector), offset) == -1 && errno == EIO;
}

std::unique_ptr<LogDevice> make_flash_device(const std::string &image, FlashNode node) {
    auto device = std::make_unique<FlashDevice>();
    if (open_flash("mtdram test device", "mtdram total_size=256 erase_size=16", &device->fd,
                   &device->reason) < 0)
        return device;
    if (!erase_flash(device->fd.get()) || !write_flash(device->fd.get(), image, 0)) {
        ADD_FAILURE() << error_of("mtdram");
        return device;
    }
    const std::string name = "oopslog-test";
    device->partition.length = static_cast<long long>(image.size());
    memcpy(device->partition.devname, name.c_str(), name.size() + 1);
    if (!change_partition(device->fd.get(), BLKPG_ADD_PARTITION, device->partition)) {
        ADD_FAILURE() << error_of("mtdram: BLKPG_ADD_PARTITION");
        return device;
    }
    device->partition.pno = find_flash(name);
    std::string path = flash_path(device->partition.pno);
    if (node == FlashNode::BLOCK) {
        path = "/dev/mtdblock" + std::to_string(device->partition.pno);
        if (access(path.c_str(), F_OK) != 0 && !load_module("mtdblock")) {
            device->reason = error_of(path);
            return device;
        }
    }
    if (wait_until([&] { return access(path.c_str(), F_OK) == 0; }))
        device->path = path;
    else
        ADD_FAILURE() << error_of(path);
    return device;
}

std::unique_ptr<LogDevice> make_bad_nand_device(const std::string &image,
                                                const std::string &bad_image) {
    auto device = std::make_unique<NandDevice>();
    // 16 MiB with blocks of 16 KiB, of which a partition of 16 is made.
    const int number = open_flash("NAND simulator partition 0",
                                  "nandsim first_id_byte=0x20 second_id_byte=0x33 parts=16",
                                  &device->fd, &device->reason);
    if (number < 0)
        return device;
    const int fd = device->fd.get();
    loff_t block = NAND_BLOCK_SIZE;
    const bool bad = ioctl(fd, MEMGETBADBLOCK, &block) > 0;
    const size_t behind = 2 * NAND_BLOCK_SIZE;
    // Marking a block erases it, so its contents come later.
    if (erase_flash(fd) && (bad || ioctl(fd, MEMSETBADBLOCK, &block) == 0) &&
        write_flash(fd, bad_image, NAND_BLOCK_SIZE) &&
        write_flash(fd, image.substr(0, NAND_BLOCK_SIZE), 0) &&
        (image.size() <= behind || write_flash(fd, image.substr(behind), behind)))
        device->path = flash_path(number);
    else
        ADD_FAILURE() << error_of("nandsim");
    return device;
}
