// The debug service at work, and its clients. Only inside a sandbox.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "support/run_program.h"
#include "support/temp_dir.h"

// A client's end of a connection whose other end the service got. Closed with the object.
class Client {
  public:
    explicit Client(int fd) : fd_(fd) {}
    Client(Client &&other) noexcept;
    Client &operator=(Client &&other) noexcept;
    ~Client();

    int fd() const { return fd_; }
    // Reads until `done(what has come so far)` or the end of the reply, and returns all that has
    // come from the beginning. Fails the test when that takes longer than `timeout_s`.
    std::string read_until(const std::function<bool(const std::string &)> &done,
                           int timeout_s = 20);
    // The same until `text` has come.
    std::string read_until_text(const std::string &text, int timeout_s = 20);
    // The whole reply.
    std::string read_all(int timeout_s = 60);
    // Whether nothing has come that was not read, and the connection is open, right now.
    bool is_waiting() const;
    void close();

  private:
    int fd_;
    std::string received_;
};

struct ServiceOptions {
    std::string core_program = "/bin/false";
    std::string dump_dir{};              // an empty folder of its own when empty
    std::vector<std::string> options{};  // further ones
    RunOptions run{};
};

// `debugar.cgi -n`, with its sockets in a folder of its own, ready for requests. Killed at the end.
class Service {
  public:
    explicit Service(const ServiceOptions &options = {});

    pid_t pid() const { return process_->pid(); }
    Background &process() { return *process_; }
    std::string cgi_socket() const { return dir_.path() + "/cgi"; }
    std::string segf_socket() const { return dir_.path() + "/segf"; }
    std::string dump_dir() const { return dump_dir_; }

    // Makes a request as the web server's front end does, on a TCP connection over loopback.
    Client request(const std::string &path, const std::string &query);
    // The same, of the given bytes: a whole message.
    Client send(const std::string &message);
    // The reply to a request.
    std::string reply(const std::string &path, const std::string &query, int timeout_s = 60);

    // Connects to the socket for crash cores, or to that for requests.
    int connect_segf() const;
    int connect_cgi() const;

    // What the service holds right now: open descriptors, threads, and children.
    int descriptors() const;
    int threads() const;
    int children() const;
    // From now on it can have `count` descriptors, numbered from 0.
    void limit_descriptors(unsigned count) const;
    // Waits until it holds as much as when it had just started.
    bool is_at_rest(int timeout_s = 20) const;

  private:
    TempDir dir_;
    std::string dump_dir_;
    std::unique_ptr<Background> process_;
    int descriptors_at_start_ = 0;
    int threads_at_start_ = 0;
};

// The header of a download.
std::string ok_header(const std::string &content_type, const std::string &file_name);
// What follows the header of a reply, if anything. Fails the test when the header is not `header`,
// unless that is empty.
std::string body_of(const std::string &reply, const std::string &header = "");
