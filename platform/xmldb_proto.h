// SPDX-License-Identifier: Apache-2.0
/* Wire protocol between the configuration database service (xmldbd) and its
 * clients (the client library, the xmldbc tool).
 *
 * One Unix stream connection carries any number of request/answer pairs, in
 * order. Every frame is a 4-byte big-endian payload length followed by the
 * payload:
 *
 *   request:  op (1 byte) | path length (4 bytes, big-endian) | path | value
 *   answer:   status (1 byte) | data
 *
 * The value runs to the end of the request payload. Status 0 is success and
 * data is the answer (a value, a dump); any other status is failure and data
 * is a short English message. Paths and values never contain NUL bytes.
 * The limits below bound every frame: a request over them is refused with an
 * error answer (when its length is still sane) or by closing the connection. */
#ifndef PLATFORM_XMLDB_PROTO_H
#define PLATFORM_XMLDB_PROTO_H

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

namespace xmldb {

inline constexpr size_t kPathMax = 4095;          // bytes of a node or file path
inline constexpr size_t kValueMax = 65536;        // bytes of one value
inline constexpr size_t kRequestMax = 1 + 4 + kPathMax + kValueMax;
inline constexpr size_t kAnswerMax = 64u << 20;   // a dump of a huge tree
inline constexpr size_t kHeaderSize = 4;

enum class Op : char {
    Get = 'g',
    Set = 's',
    Del = 'd',
    Save = 'w',   // path: file to write the whole tree to
    Load = 'r',   // path: file whose tree replaces the current one
    Dump = 'l',   // path: subtree to list as text
    Ping = 'p',
};

enum Status : uint8_t { kOk = 0, kFail = 1 };

// Appends one request frame to out.
void encode_request(std::string &out, Op op, std::string_view path, std::string_view value);
// Appends one answer frame to out.
void encode_answer(std::string &out, Status status, std::string_view data);
// Appends an answer's header only: the caller appends data_size bytes of data.
void begin_answer(std::string &out, Status status, size_t data_size);

struct Request {
    Op op;
    std::string_view path;
    std::string_view value;
};
// Splits a request payload (without its length header). False when malformed.
bool decode_request(std::string_view payload, Request &req);

uint32_t load_be32(const unsigned char *p);

// A caller's deadline for one whole exchange.
using Clock = std::chrono::steady_clock;

// Writes/reads exactly len bytes on a socket, waiting at most until deadline.
// Never raises SIGPIPE. False on error, end of stream or time-out.
bool send_all(int fd, const void *buf, size_t len, Clock::time_point deadline);
bool recv_all(int fd, void *buf, size_t len, Clock::time_point deadline);

}  // namespace xmldb

#endif
