// What is at the other end of eth0's cable. Only inside a sandbox that has eth0.
#pragma once

#include <string>

#include "support/packets.h"

// A network of its own, into which eth1 goes for good, with the address 10.99.0.2. No process lives
// there; what the test has to do there it does through this object. The network lasts until the
// object and the sockets of it are gone.
class FarNetwork {
  public:
    // With another address of eth1, as `ip addr add` takes it.
    explicit FarNetwork(const std::string &address = "10.99.0.2/24");
    ~FarNetwork();
    FarNetwork(const FarNetwork &) = delete;
    FarNetwork &operator=(const FarNetwork &) = delete;

    // A socket there, which the caller closes. It stays one of there, whoever binds or connects it.
    int make_socket(int family, int type) const;
    // A TCP connection from a client there to a server at 10.99.0.1.
    void connect_to_us(TcpConnection *ret) const;
    // Nothing that is sent there leaves it any more, and nothing reaches it.
    void cut_off() const;

  private:
    void shell(const std::string &command) const;

    int ours_;
    int theirs_;
};
