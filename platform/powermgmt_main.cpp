// SPDX-License-Identifier: Apache-2.0
// powermgmt: the platform's power-management command, as far as the
// management library uses it.
//
//   powermgmt -s    prints "result: <mask>" (hexadecimal), bit i set when
//                   disk i of the system-information database's "/disks"
//                   list (from 0) is in standby
//
// Each disk is asked with "hdparm -C /dev/<name>", which reads the drive's
// power mode without spinning it up. A disk that does not answer (no such
// device, not ATA, hdparm missing) counts as awake. With more than 32 disks,
// disk i shares bit i % 32, and a bit is set when any disk sharing it sleeps,
// so that a reader never wakes a sleeping disk by mistake.
#include <algorithm>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <string>
#include <string_view>

#include "common/korvadm_str.h"
#include "common/korvadm_sysroot.h"
#include "platform/platform_util.h"
#include "platform/xmldbc.h"

namespace {

constexpr int kMaxDisks = 256;  // as the management library clamps the count

bool sysinfo_get(const std::string &key, std::string &value)
{
    char buf[1024];
    if (xmldbc_get_wb(XMLDB_SOCK_SYSINFO, 0, key.c_str(), buf, sizeof buf) < 0)
        return false;
    value = buf;
    return true;
}

// A device name is one path component.
bool sane_name(const std::string &name)
{
    return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos;
}

// True when hdparm reports the drive in standby (or sleeping).
bool disk_asleep(const std::string &name)
{
    if (!sane_name(name)) {
        std::fprintf(stderr, "powermgmt: bad disk name \"%s\", taken as awake\n", name.c_str());
        return false;
    }
    std::string cmd = "hdparm -C \"" + korv::shell_escape(sysroot_path(("/dev/" + name).c_str())) + "\" 2>/dev/null";
    std::string state;
    int status = korv::read_command_lines(cmd.c_str(), [&](std::string_view line) {
        constexpr std::string_view kMarker = "drive state is:";
        size_t at = line.find(kMarker);
        if (at != std::string_view::npos) {
            std::string_view rest = line.substr(at + kMarker.size());
            size_t b = rest.find_first_not_of(" \t");
            state = b == std::string_view::npos ? "" : std::string(rest.substr(b, rest.find_last_not_of(" \t") + 1 - b));
        }
        return true;
    });
    return status == 0 && (state == "standby" || state == "sleeping");
}

int usage()
{
    std::fprintf(stderr, "usage: powermgmt -s\n"
                         "  -s  print \"result: MASK\": bit i (hexadecimal mask) set when disk i sleeps\n");
    return 2;
}

}  // namespace

int main(int argc, char **argv)
{
    if (argc != 2 || std::strcmp(argv[1], "-s") != 0)
        return usage();
    std::string text;
    if (!sysinfo_get("/disks/disk#", text)) {
        std::fprintf(stderr, "powermgmt: cannot read the disk list\n");
        return 1;
    }
    long long count = 0;
    if (str2ll(text.c_str(), &count) != 0)
        count = 0;
    count = std::clamp(count, 0LL, static_cast<long long>(kMaxDisks));

    uint32_t mask = 0;
    for (int i = 0; i < count; ++i) {
        std::string name;
        if (!sysinfo_get("/disks/disk:" + std::to_string(i + 1) + "/name", name)) {
            std::fprintf(stderr, "powermgmt: cannot read the disk list\n");
            return 1;
        }
        if (disk_asleep(name))
            mask |= 1u << (i % 32);
    }
    std::printf("result: %x\n", mask);
    return 0;
}
