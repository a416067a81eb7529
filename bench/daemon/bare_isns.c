// SPDX-License-Identifier: Apache-2.0
/* Memory anchor: the daemon's exchanges in plain C, linked as the daemon is
 * (shared glibc). Resolves the server with getaddrinfo, registers COUNT
 * targets named PREFIX EID ':' 't' N, each with the same portals, in the
 * daemon's messages (the entity with its first node and the portals, then one
 * message per further node), one TCP connection per exchange; then checks,
 * every PERIOD seconds, that the server holds the first node (DevAttrQry),
 * waiting in ppoll as the daemon does.
 *   nesrad_bare_isns SERVER EID PREFIX COUNT PERIOD PORT ADDRESS... */
#define _GNU_SOURCE /* ppoll */
#include <arpa/inet.h>
#include <netdb.h>
#include <poll.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <time.h>
#include <unistd.h>

enum { PDU_MAX = 10000, HDR = 12, MAX_PORTALS = 8 };
enum { TAG_DELIM = 0, TAG_EID = 1, TAG_PROTO = 2, TAG_IP = 16, TAG_PORT = 17, TAG_NAME = 32, TAG_TYPE = 33,
       TAG_PG_NAME = 48, TAG_PG_IP = 49, TAG_PG_PORT = 50, TAG_PG_TAG = 51 };

static unsigned char pdu[PDU_MAX];
static size_t pos;
static struct sockaddr_storage server;
static socklen_t server_len;

static void put32(uint32_t v)
{
    pdu[pos++] = (unsigned char)(v >> 24);
    pdu[pos++] = (unsigned char)(v >> 16);
    pdu[pos++] = (unsigned char)(v >> 8);
    pdu[pos++] = (unsigned char)v;
}

static void hdr(int func)
{
    static const unsigned char h[HDR] = {0, 1, 0, 0, 0, 0, 0x8c, 0, 0, 0, 0, 0};
    memcpy(pdu, h, HDR);
    pdu[3] = (unsigned char)func;
    pos = HDR;
}

static void attr_str(int tag, const char *s)
{
    size_t n = strlen(s) + 1, padded = (n + 3) & ~(size_t)3;
    put32((uint32_t)tag);
    put32((uint32_t)padded);
    memset(pdu + pos, 0, padded);
    memcpy(pdu + pos, s, n);
    pos += padded;
}

static void attr_u32(int tag, uint32_t v)
{
    put32((uint32_t)tag);
    put32(4);
    put32(v);
}

static void attr_empty(int tag)
{
    put32((uint32_t)tag);
    put32(0);
}

static void attr_ip(int tag, const unsigned char ip[16])
{
    put32((uint32_t)tag);
    put32(16);
    memcpy(pdu + pos, ip, 16);
    pos += 16;
}

static int read_all(int fd, unsigned char *to, size_t n)
{
    while (n > 0) {
        ssize_t r = recv(fd, to, n, 0);
        if (r <= 0)
            return -1;
        to += r;
        n -= (size_t)r;
    }
    return 0;
}

/* One exchange: the response's status word, or -1. */
static int exchange(void)
{
    pdu[4] = (unsigned char)((pos - HDR) >> 8);
    pdu[5] = (unsigned char)(pos - HDR);
    int fd = socket(server.ss_family, SOCK_STREAM | SOCK_CLOEXEC, 0);
    if (fd < 0)
        return -1;
    int status = -1;
    unsigned char h[HDR];
    struct timeval tv = {5, 0};
    setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
    if (connect(fd, (struct sockaddr *)&server, server_len) == 0 && send(fd, pdu, pos, MSG_NOSIGNAL) == (ssize_t)pos &&
        read_all(fd, h, HDR) == 0) {
        size_t len = (size_t)h[4] << 8 | h[5];
        if (len >= 4 && len <= PDU_MAX && read_all(fd, pdu, len) == 0)
            status = pdu[0] << 24 | pdu[1] << 16 | pdu[2] << 8 | pdu[3];
    }
    close(fd);
    return status;
}

int main(int argc, char **argv)
{
    if (argc < 8 || argc - 7 > MAX_PORTALS) {
        fprintf(stderr, "usage: nesrad_bare_isns SERVER EID PREFIX COUNT PERIOD PORT ADDRESS...\n");
        return 2;
    }
    const char *eid = argv[2], *prefix = argv[3];
    int count = atoi(argv[4]), period = atoi(argv[5]), portals = argc - 7;
    uint32_t port = (uint32_t)atoi(argv[6]);
    unsigned char ip[MAX_PORTALS][16] = {{0}};
    for (int p = 0; p < portals; p++) {
        const char *a = argv[7 + p];
        ip[p][10] = ip[p][11] = 0xff; /* IPv4 mapped into IPv6 */
        if (inet_pton(AF_INET, a, ip[p] + 12) != 1 && inet_pton(AF_INET6, a, ip[p]) != 1)
            return 2;
    }
    struct addrinfo hints = {.ai_socktype = SOCK_STREAM}, *res;
    if (getaddrinfo(argv[1], "3205", &hints, &res) != 0)
        return 1;
    memcpy(&server, res->ai_addr, res->ai_addrlen);
    server_len = res->ai_addrlen;
    freeaddrinfo(res);

    char first[256], name[256];
    snprintf(first, sizeof first, "%s%s:t1", prefix, eid);
    for (int i = 1; i <= count; i++) {
        snprintf(name, sizeof name, "%s%s:t%d", prefix, eid, i);
        hdr(1);
        attr_str(TAG_NAME, first);
        attr_str(TAG_EID, eid);
        attr_empty(TAG_DELIM);
        attr_str(TAG_EID, eid);
        if (i == 1) {
            attr_u32(TAG_PROTO, 2);
            for (int p = 0; p < portals; p++) {
                attr_ip(TAG_IP, ip[p]);
                attr_u32(TAG_PORT, port);
            }
        }
        attr_str(TAG_NAME, name);
        attr_u32(TAG_TYPE, 1);
        for (int p = 0; p < portals; p++) {
            attr_str(TAG_PG_NAME, name);
            attr_ip(TAG_PG_IP, ip[p]);
            attr_u32(TAG_PG_PORT, port);
            attr_u32(TAG_PG_TAG, 1);
        }
        if (exchange() != 0)
            fprintf(stderr, "nesrad_bare_isns: %s not registered\n", name);
    }
    for (;;) {
        struct timespec ts = {period, 0};
        ppoll(NULL, 0, &ts, NULL);
        hdr(2);
        attr_str(TAG_NAME, first);
        attr_str(TAG_NAME, first);
        attr_u32(TAG_TYPE, 1);
        attr_empty(TAG_DELIM);
        attr_empty(TAG_NAME);
        if (exchange() < 0)
            fprintf(stderr, "nesrad_bare_isns: the check failed\n");
    }
}
