// SPDX-License-Identifier: Apache-2.0
/* The request path under the xmldbc_* calls, for the xmldbc tool and tests.
 *
 * One process-wide connection per socket is kept open and reused (reopened
 * after fork and after the service restarts); calls from several threads are
 * serialised. Every call is bounded by kCallTimeout. */
#ifndef PLATFORM_XMLDB_CLIENT_H
#define PLATFORM_XMLDB_CLIENT_H

#include "platform/xmldb_proto.h"

#include <string>
#include <string_view>

namespace xmldb {

inline constexpr std::chrono::milliseconds kCallTimeout{2000};

enum class CallResult {
    Ok,          // the service answered success; data holds the answer
    Refused,     // the service answered failure; data holds its message
    Unreachable, // no answer (no service, bad socket path, time-out); data says why
};

// Sends one request over the socket at mapped_sock (already mapped through
// the system root) and waits for its answer. Requests over the protocol's
// limits are refused locally (Refused).
CallResult call(const std::string &mapped_sock, Op op, std::string_view path, std::string_view value,
                std::string &data);

// Maps a fixed socket path through the system root; false (with why) when it
// is not absolute or does not fit a Unix socket address.
bool map_socket(const char *sock, std::string &mapped, std::string &why);

}  // namespace xmldb

#endif
