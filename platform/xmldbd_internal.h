// SPDX-License-Identifier: Apache-2.0
/* What the files of xmldbd share: its options, its one message function and
 * the service (xmldbd_service.cpp: lock, socket, clients and their answer
 * budget; xmldbd_requests.cpp: what requests do to the tree and its files). */
#ifndef PLATFORM_XMLDBD_INTERNAL_H
#define PLATFORM_XMLDBD_INTERNAL_H

#include "platform/xmldb_proto.h"
#include "platform/xmldb_tree.h"

#include <csignal>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <sys/types.h>
#include <vector>

namespace xmldbd {

inline constexpr size_t kPendingMax = 64u << 20;  // answers held for all clients together

/* xmldbd_main.cpp */
struct Options {
    std::string socket;
    std::string load;
    bool empty = false;
    std::vector<std::string> allow_dirs;
    int ready_fd = -1;
};

// Set by SIGTERM and SIGINT, which are delivered only while the loop waits.
extern volatile sig_atomic_t g_stop;

// One line "xmldbd: ..." on standard error.
void say(const char *fmt, ...) __attribute__((format(printf, 1, 2)));

/* xmldbd_requests.cpp */
std::string parent_of(const std::string &p);

// One tree served on one socket by one thread; run() returns the exit status.
class Service {
public:
    explicit Service(Options o) : opt_(std::move(o)) {}
    int run();

private:
    struct Conn {
        int fd;
        std::string in;
        std::string out;
        size_t out_off = 0;
        bool closing = false;  // flush out, then close
        bool drop = false;     // over the answer budget: close at once
        uint64_t last_active = 0;
    };

    bool take_lock();
    bool load_at_start();
    bool listen_socket();
    void accept_all();
    void close_conn(Conn &c);
    void evict_idlest();
    bool read_conn(Conn &c);
    bool write_conn(Conn &c);
    void handle_frames(Conn &c);
    void handle(const xmldb::Request &r, Conn &c);
    void dump(std::string_view path, Conn &c);
    bool save_target(const std::string &file, std::string &resolved, std::string &err) const;

    Options opt_;
    xmldb::Tree tree_;
    int lock_fd_ = -1;  // held for the service's life, never closed
    int lfd_ = -1;
    ino_t sock_ino_ = 0;
    std::vector<std::unique_ptr<Conn>> conns_;
    size_t pending_ = 0;         // bytes of answers held for all clients
    bool accept_paused_ = false;  // out of descriptors: wait for a client to leave
    uint64_t tick_ = 0;
};

}  // namespace xmldbd

#endif
