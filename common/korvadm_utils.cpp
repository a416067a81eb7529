// SPDX-License-Identifier: Apache-2.0
// Commands, files and locks: module and path checks, file helpers, shell
// commands, the cross-process semaphore, prealloc control, text checks.
#include "common/korvadm_utils.h"

#include <fcntl.h>
#include <signal.h>
#include <sys/ipc.h>
#include <sys/sem.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <string>
#include <string_view>

#include "common/korvadm_log.h"
#include "common/korvadm_sysroot.h"
#include "platform/platform_util.h"

namespace {

using korv::c_buffer;
using korv::file_ptr;

// A format that holds exactly one %s, outside any quotes, and otherwise only
// %% is safe to hand to the printf-style runner with one quoted value: a %s
// inside the format's own quotes would end them and let the value run.
bool has_single_bare_string_conversion(std::string_view fmt)
{
    int strings = 0;
    char quote = 0;
    for (size_t i = 0; i < fmt.size(); ++i) {
        char c = fmt[i];
        if (c == '%') {
            if (i + 1 >= fmt.size())
                return false;
            c = fmt[++i];
            if (c == 's' && !quote)
                ++strings;
            else if (c != '%')
                return false;
        } else if (quote) {
            if (c == quote)
                quote = 0;
            else if (c == '\\' && quote == '"')
                ++i;
        } else if (c == '\\') {
            ++i;
        } else if (c == '\'' || c == '"') {
            quote = c;
        }
    }
    return strings == 1;
}

union semun_arg {
    int val;
    struct semid_ds *buf;
    unsigned short *array;
};

// Pid of the prealloc process of lun_name, when it is alive: > 0; -1 no pid
// file or no such process; -2 unreadable file, bad pid or bad name.
int read_prealloc_pid(const char *lun_name)
{
    if (!lun_name || !*lun_name || std::strchr(lun_name, '/'))
        return -2;
    std::string path = sysroot_path("/var/run/prealloc_") + lun_name + ".pid";
    if (check_path_exist(path.c_str()) != 0)
        return -1;
    file_ptr f(std::fopen(path.c_str(), "r"));
    if (!f)
        return -2;
    int pid = 0;
    if (std::fscanf(f.get(), "%40d", &pid) != 1 || pid < 1)
        return -2;
    if (kill(pid, 0) != 0) {
        if (errno != ESRCH)
            std::perror("Error to check process!");
        return -1;
    }
    return pid;
}

}  // namespace

/* ---------------------------------------------------------------- modules */

int check_kmodule_inserted(const char *name)
{
    if (!name || !*name)
        return -1;
    std::string path = sysroot_path("/proc/modules");
    file_ptr f(std::fopen(path.c_str(), "r"));
    if (!f) {
        DBG(0, "Can not open %s", path.c_str());
        return -1;
    }
    // Lines are read in 100-byte pieces; module names sit at the line start,
    // well inside the first piece.
    char line[100];
    int rc = -1;
    while (std::fgets(line, sizeof line, f.get())) {
        if (std::strstr(line, name)) {
            rc = 0;
            break;
        }
    }
    DBG(2, "check_module_inserted() : %s %s", name, rc == 0 ? "has inserted" : "has not inserted");
    return rc;
}

int check_path_exist(const char *path)
{
    if (!path || !*path)
        return -1;
    if (access(path, F_OK) != 0) {
        DBG(2, "file path is not vaild : %s, msg = %s", path, std::strerror(errno));
        return -1;
    }
    return 0;
}

int check_path_access(const char *path, unsigned int mode)
{
    if (!path || !*path)
        return -1;
    if (access(path, static_cast<int>(mode)) != 0) {
        DBG(2, "file path is not valid : %s in access right %u", path, mode);
        return -1;
    }
    return 0;
}

/* ------------------------------------------------------ directories/files */

int make_dir(const char *path, mode_t mode)
{
    if (!path || !*path)
        return -1;
    DBG(2, "mkdir %s ", path);
    if (mkdir(path, mode) == 0 || errno == EEXIST)
        return 0;
    DBG(0, "mkdir %s failed", path);
    return -1;
}

int make_dir_include_parent(const char *path, mode_t mode)
{
    if (!path || !*path)
        return -1;
    if (mode == 0)
        mode = 0700;
    std::string copy(path);
    // Parent first: the last '/' past the first character bounds it.
    size_t slash = copy.size() > 1 ? copy.find_last_of('/', copy.size() - 1) : std::string::npos;
    if (slash != std::string::npos && slash >= 1) {
        std::string parent = copy.substr(0, slash);
        if (make_dir_include_parent(parent.c_str(), mode) != 0)
            return -1;
    }
    if (mkdir(path, mode) == 0) {
        DBG(2, "mkdir %s - successed", path);
        return 0;
    }
    struct stat st;
    if (errno == EEXIST && stat(path, &st) == 0 && S_ISDIR(st.st_mode))
        return 0;
    DBG(0, "mkdir %s failed", path);
    return -1;
}

namespace {
// Missing counts as removed: teardown often runs over half-removed state.
// Logs under the caller's name.
int remove_entry(const char *func, const char *path, int (*remove_fn)(const char *), const char *verb)
{
    if (!path || !*path)
        return -1;
    DBG_AS(func, 2, "%s %s ", verb, path);
    return remove_fn(path) == 0 || errno == ENOENT ? 0 : -1;
}
}  // namespace

int remove_dir(const char *path)
{
    return remove_entry(__func__, path, rmdir, "rmdir");
}

int remove_dir_recurive(const char *path)
{
    if (!path)
        return -1;
    if (!*path)
        return 0;
    std::string escaped;
    if (!korv::shell_escape(path, escaped))
        return -1;
    if (System("rm -rf \"%s\" > /dev/null 2>&1", escaped.c_str()) != 0) {
        DBG(0, "remove dircetory recursively : %s failed", path);
        return -1;
    }
    return 0;
}

int remove_file(const char *path)
{
    return remove_entry(__func__, path, unlink, "unlink");
}

int create_file_if_absent(const char *path, mode_t mode)
{
    if (!path || !*path)
        return -1;
    if (access(path, F_OK) == 0)
        return 0;
    int fd = open(path, O_CREAT | O_EXCL | O_NOFOLLOW | O_WRONLY | O_CLOEXEC, mode);
    if (fd < 0)
        return -1;
    close(fd);
    return 0;
}

int check_dir_is_writable(const char *dir, const char *name, unsigned long long count)
{
    if (!dir || !*dir || !name || !*name)
        return -1;
    size_t buf_size = 512 * 1024;
    c_buffer buf(static_cast<char *>(std::calloc(1, buf_size)));
    if (!buf) {
        buf_size = 4096;
        buf.reset(static_cast<char *>(std::calloc(1, buf_size)));
        if (!buf)
            return -1;
    }
    // Never an existing entry: on a volume users write to, a link or file
    // planted at this name must not make us truncate or remove anything.
    std::string path = std::string(dir) + "/" + name;
    int fd = open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600);
    if (fd < 0) {
        if (errno == EEXIST)
            DBG(0, "%s already exists and is left alone: not writable", path.c_str());
        DBG(1, "open file %s failed", path.c_str());
        return -1;
    }
    int rc = 0;
    unsigned long long left = count;
    while (left > 0) {
        size_t chunk = left < buf_size ? static_cast<size_t>(left) : buf_size;
        ssize_t n = write(fd, buf.get(), chunk);
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0) {
            rc = -1;
            break;
        }
        left -= static_cast<unsigned long long>(n);
    }
    if (close(fd) != 0)
        rc = -1;
    unlink(path.c_str());
    return rc;
}

int get_file_alloc_size(unsigned long long *size, const char *path)
{
    if (!size)
        return -1;
    *size = 0;
    struct stat st;
    if (!path || stat(path, &st) != 0) {
        DBG(0, "lun_get_alloc_size: stat failed");
        return -1;
    }
    *size = static_cast<unsigned long long>(st.st_blocks) << 9;
    return 0;
}

int create_symlink(const char *target, const char *link)
{
    if (!target || !*target || !link || !*link)
        return -1;
    if (symlink(target, link) == 0)
        return 0;
    if (errno != EEXIST) {
        std::perror("create_symlink");
        return -1;
    }
    char existing[512];
    ssize_t n = readlink(link, existing, sizeof existing - 1);
    if (n < 0)
        return -1;
    existing[n] = '\0';
    return std::strcmp(existing, target) == 0 ? 0 : -2;
}

/* --------------------------------------------------------------- commands */

int run_system_cmd(const char *fmt, const char *arg)
{
    if (!fmt || !arg || !has_single_bare_string_conversion(fmt))
        return -1;
    // The value is one double-quoted shell word whatever the format does.
    std::string escaped;
    if (!korv::shell_escape(arg, escaped))
        return -1;
    std::string quoted = "\"" + escaped + "\"";
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"
    int status = System(fmt, quoted.c_str());
#pragma GCC diagnostic pop
    return status == 0 ? 0 : -1;
}

int process_system_cmd_mt(const char *cmd, int tries, int max_delay_us)
{
    if (!cmd)
        return -1;
    std::srand(static_cast<unsigned>(std::time(nullptr)));
    int status = 0;
    for (int i = 0; i < tries; ++i) {
        if (i > 0 && max_delay_us >= 2) {
            int delay = std::rand() % max_delay_us;
            DBG(1, "retry cmd : cycle = %d, time = %d", i, delay);
            usleep(static_cast<useconds_t>(delay));
        }
        status = std::system(cmd);
        if (status == 0)
            break;
        DBG(0, "system() of cmd '%s' failed", cmd);
        DBG(2, "!!!ret=%d, WIFEXITED=%d, WEXITSTATUS=%d", status, (status & 0x7f) == 0 ? 1 : 0,
            (status >> 8) & 0xff);
    }
    return status;
}

/* ------------------------------------------------------------------- lock */

int sem_P(int *sem_id, key_t key)
{
    if (!sem_id)
        return -1;
    int id = semget(key, 1, 0666);
    if (id == -1) {
        DBG(2, "semget(...) == -1, errno = %d", errno);
        if (errno != ENOENT && errno != EIDRM) {
            DBG(0, "semget() failed");
            return -1;
        }
        DBG(2, "try to semget(%d 1, 0666 | IPC_CREATE )", static_cast<int>(key));
        id = semget(key, 1, 0666 | IPC_CREAT);
        if (id == -1) {
            DBG(0, "semget(..., IPC_CREATE ) failed");
            return -1;
        }
        DBG(2, "try to semctl(%d,0,SETVAL, 1 )", id);
        semun_arg arg;
        arg.val = 1;
        if (semctl(id, 0, SETVAL, arg) == -1) {
            DBG(0, "semctl() failed, errno = %d", errno);
            semctl(id, 0, IPC_RMID);
            return -1;
        }
    }
    *sem_id = id;
    DBG(2, "get sem_id = %d", id);
    DBG(2, "try to get a sem, sem_id = %d, trying......", id);
    struct sembuf op = {0, -1, SEM_UNDO};
    if (semop(id, &op, 1) == -1) {
        DBG(0, "set sem failed");
        return -2;
    }
    DBG(1, "pid = %lu, go into critical section ...", static_cast<unsigned long>(getpid()));
    return 0;
}

int sem_V(int *sem_id, key_t key)
{
    if (!sem_id)
        return -2;
    int waiting = semctl(*sem_id, 0, GETNCNT);
    DBG(2, "semncnt = %d", waiting);
    if (waiting < 1) {
        DBG(2, "try to remove a sem,sem_key = %d, using sem_id = %d, trying......", static_cast<int>(key),
            *sem_id);
        if (semctl(*sem_id, 0, IPC_RMID) == 0) {
            *sem_id = -1;
            return 0;
        }
        DBG(0, "remove sem_id failed, errno = %d", errno);
    }
    DBG(2, "try to RELEASE a sem, sem_id = %d, trying......", *sem_id);
    struct sembuf op = {0, 1, SEM_UNDO};
    if (semop(*sem_id, &op, 1) == -1) {
        DBG(0, "release sem failed");
        return -2;
    }
    return 0;
}

/* --------------------------------------------------------------- prealloc */

void stop_prealloc(const char *lun_name)
{
    if (!lun_name || !*lun_name) {
        DBG(0, "lun name not given!");
        return;
    }
    int pid = read_prealloc_pid(lun_name);
    if (pid < 1)
        return;
    DBG(0, "STOP prealloc, lun: %s!!!\n", lun_name);
    if (kill(pid, SIGTERM) != 0 && errno != ESRCH)
        std::perror("Error to signal process!");
}

int check_any_prealloc_running(void)
{
    // The first line decides, as it always has.
    int found = 0;
    int status = korv::read_command_lines("ps | grep prealloc | grep -v 'grep'", [&](std::string_view line) {
        found = line.find("prealloc") != std::string_view::npos;
        return false;
    });
    if (status == -1) {
        DBG(0, "failed to check running process!");
        return -1;
    }
    return found;
}

void kill_all_prealloc(void)
{
    System("killall prealloc");
}

/* ------------------------------------------------------------ text checks */

int check_name_chars_valid(const char *text)
{
    if (!text)
        return -1;
    size_t len = std::strlen(text);
    if (len < 1 || len > 223)
        return -1;
    for (const char *p = text; *p; ++p) {
        char c = *p;
        bool ok = (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' || c == '.' || c == ':';
        if (!ok)
            return -1;
    }
    return 0;
}

namespace {
// Stores the ':'-separated groups of text big-endian from group `first` on.
// False when a group would fall outside the 8 groups.
bool store_groups(unsigned char out[16], std::string_view text, int first)
{
    int idx = first;
    while (true) {
        size_t colon = text.find(':');
        std::string group(text.substr(0, colon));
        if (colon == std::string_view::npos && group.empty())
            return true;  // an empty last group stores nothing
        if (idx < 0 || idx > 7)
            return false;
        unsigned long v = std::strtoul(group.c_str(), nullptr, 16);
        out[idx * 2] = static_cast<unsigned char>((v >> 8) & 0xff);
        out[idx * 2 + 1] = static_cast<unsigned char>(v & 0xff);
        ++idx;
        if (colon == std::string_view::npos)
            return true;
        text.remove_prefix(colon + 1);
    }
}
}  // namespace

int ipv6_text_to_bytes(unsigned char out[16], const char *text)
{
    if (!out || !text || std::strlen(text) < 3)
        return -1;
    std::memset(out, 0, 16);
    std::string_view t(text);
    size_t gap = t.find("::");
    if (gap == std::string_view::npos)
        return store_groups(out, t, 0) ? 0 : -1;
    std::string_view head = t.substr(0, gap);
    std::string_view tail = t.substr(gap + 2);
    if (!head.empty() && !store_groups(out, head, 0))
        return -1;
    if (tail.empty())
        return 0;
    // The groups after "::" end at group 7.
    int colons = 0;
    for (char c : tail)
        colons += c == ':';
    return store_groups(out, tail, 7 - colons) ? 0 : -1;
}

int is_ipv6_link_local(const char *text)
{
    unsigned char b[16];
    if (ipv6_text_to_bytes(b, text) != 0)
        return -1;
    if (b[0] != 0xfe || (b[1] & 0xc0) != 0x80)
        return 0;
    for (int i = 2; i < 8; ++i)
        if (b[i] != 0)
            return 0;
    return 1;
}
