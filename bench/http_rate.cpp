// Asks a web server on loopback for pages, round after round, and prints how many it gives in a
// second as rows of a table.
//
//   http_rate ROUNDS PORT CLIENTS REQUESTS TEXT NAME PATH [NAME PATH]...
//
// In each round every path is asked for REQUESTS times by CLIENTS clients at once; each reply has
// to hold TEXT. The first path is the one in question: the ratios are its rate over that of each
// other one in the same round. All figures are medians.
#include <arpa/inet.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <string>
#include <vector>

#include "rounds.h"

namespace {

struct Page {
    std::string name;
    std::string path;
    std::vector<double> rates;
};

bool get(uint16_t port, const std::string &path, const char *text) {
    const int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(port);
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const std::string request = "GET " + path + " HTTP/1.0\r\n\r\n";
    std::string reply;
    if (connect(fd, reinterpret_cast<sockaddr *>(&address), sizeof(address)) == 0 &&
        send(fd, request.data(), request.size(), MSG_NOSIGNAL) ==
            static_cast<ssize_t>(request.size())) {
        char block[65536];
        for (ssize_t n; (n = read(fd, block, sizeof(block))) > 0;)
            reply.append(block, static_cast<size_t>(n));
    }
    close(fd);
    return reply.find(text) != std::string::npos;
}

// Returns the pages per second. Ends the program when a reply is wrong.
double measure(uint16_t port, int clients, int requests, const char *text,
               const std::string &path) {
    const double begin = now();
    for (int i = 0; i < clients; ++i) {
        const pid_t pid = fork();
        if (pid == 0) {
            for (int n = i; n < requests; n += clients) {
                if (!get(port, path, text))
                    _exit(1);
            }
            _exit(0);
        }
    }
    for (int i = 0; i < clients; ++i) {
        int status;
        if (wait(&status) < 0 || status != 0) {
            fprintf(stderr, "http_rate: a reply for %s is not as expected\n", path.c_str());
            exit(1);
        }
    }
    return requests / (now() - begin);
}

}  // namespace

int main(int argc, char **argv) {
    if (argc < 8 || argc % 2 != 0) {
        fputs("usage: http_rate ROUNDS PORT CLIENTS REQUESTS TEXT NAME PATH...\n", stderr);
        return 2;
    }
    std::vector<Page> pages;
    for (int i = 6; i < argc; i += 2)
        pages.push_back({argv[i], argv[i + 1], {}});
    for (int round = 0; round < atoi(argv[1]); ++round) {
        for (Page &page : pages)
            page.rates.push_back(measure(static_cast<uint16_t>(atoi(argv[2])), atoi(argv[3]),
                                         atoi(argv[4]), argv[5], page.path));
    }
    for (const Page &page : pages) {
        printf("| %s | %.0f |", page.name.c_str(), median(page.rates));
        if (&page == &pages[0]) {
            puts(" |");
            continue;
        }
        std::vector<double> ratios;
        for (size_t i = 0; i < page.rates.size(); ++i)
            ratios.push_back(pages[0].rates[i] / page.rates[i]);
        printf(" %.2f |\n", median(ratios));
    }
    return 0;
}
