// SPDX-License-Identifier: Apache-2.0
// libFuzzer target: arbitrary bytes as the iSNS server's response, through
// the receive path (PDU headers, joining, the buffer limit) and the
// registration check's walk of the attributes.
//
// Invariants checked beyond the sanitizers: the joined payload never exceeds
// the buffer or the bytes sent, and the check answers 1 only when the name
// (with its NUL) really is in the response.
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>

#include "isns/isns_internal.h"
#include "isns/isns_pdu.h"
#include "isns/isns_transport.h"

namespace {
constexpr char kName[] = "iqn.2026-01.test:nas1.t1";
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t *data, size_t size)
{
    if (size > 65536)
        return 0;
    int sv[2];
    if (socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, sv) != 0)
        return 0;
    int buf = 1 << 20;
    setsockopt(sv[0], SOL_SOCKET, SO_SNDBUF, &buf, sizeof buf);
    size_t off = 0;
    while (off < size) {
        const ssize_t w = write(sv[0], data + off, size - off);
        if (w <= 0)
            break;
        off += static_cast<size_t>(w);
    }
    shutdown(sv[0], SHUT_WR);

    const int n = recv_response(sv[1]);
    if (n < 0 || n > ISNS_PDU_SIZE || static_cast<size_t>(n) > size)
        __builtin_trap();
    (void)_isns_registration_period(_isns_response_status(n));
    const int r = _isns_query_result(_isns_response_status(n));
    const int held = _isns_check_result(kName, r);
    if (held < -1 || held > 1)
        __builtin_trap();
    if (held == 1 && !memmem(data, size, kName, sizeof kName))
        __builtin_trap();
    close(sv[0]);
    close(sv[1]);
    return 0;
}
