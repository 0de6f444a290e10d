#include "support/far_network.h"

#include <errno.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <string.h>
#include <unistd.h>

#include "support/run_program.h"
#include "support/sandbox.h"

namespace {

int open_network() {
    return open("/proc/self/ns/net", O_RDONLY | O_CLOEXEC);
}

void enter(int network) {
    EXPECT_EQ(0, setns(network, CLONE_NEWNET)) << strerror(errno);
}

}  // namespace

FarNetwork::FarNetwork(const std::string &address) : ours_(open_network()) {
    EXPECT_EQ(0, unshare(CLONE_NEWNET)) << strerror(errno);
    theirs_ = open_network();
    {
        // Known to `ip` by a process that lives in it.
        Background holder({"/bin/sleep", "1000"});
        enter(ours_);
        sandbox_shell("ip link set eth1 netns " + std::to_string(holder.pid()));
    }
    shell("ip link set eth1 up && ip addr add " + address + " dev eth1");
}

FarNetwork::~FarNetwork() {
    close(ours_);
    close(theirs_);
}

int FarNetwork::make_socket(int family, int type) const {
    enter(theirs_);
    const int fd = socket(family, type | SOCK_CLOEXEC, 0);
    enter(ours_);
    return fd;
}

void FarNetwork::connect_to_us(TcpConnection *ret) const {
    ret->client = make_socket(AF_INET, SOCK_STREAM);
    connect_tcp("10.99.0.1", "10.99.0.1", ret);
}

void FarNetwork::cut_off() const {
    shell("ip link set eth1 down");
}

void FarNetwork::shell(const std::string &command) const {
    enter(theirs_);
    sandbox_shell(command);
    enter(ours_);
}
