// SPDX-License-Identifier: Apache-2.0
/* Commands, files and locks: the system half of the management library's
 * utility layer.
 *
 * Kernel-module and path checks, directory and file helpers, shell commands
 * (escaped) with optional randomised retry, the System V semaphore used as a
 * cross-process lock, control of the background "prealloc" processes that
 * pre-allocate LUN files, and small text checks (names, IPv6 addresses).
 * The database half of the utilities lives in config/korvadm_utils_db.h.
 *
 * Paths given to these helpers are used as they are (already mapped through
 * the system root); only the fixed paths read here ("/proc/modules",
 * "/var/run/prealloc_<lun>.pid") are mapped inside. Unless stated, functions
 * return 0 on success and -1 on failure, and log their failures. */
#ifndef KORVADM_UTILS_H
#define KORVADM_UTILS_H

#include <stddef.h>
#include <sys/types.h>

#ifdef __cplusplus
extern "C" {
#endif

/* ---- kernel modules and paths ---- */

/* 0 when some line of "/proc/modules" contains `name` as a substring (so a
 * longer module name containing it matches too); -1 when none does, the file
 * cannot be read, or name is NULL/empty. */
int check_kmodule_inserted(const char *name);

/* 0 when path exists (access F_OK), -1 for NULL, "" or a missing path. */
int check_path_exist(const char *path);
/* As check_path_exist with the access(2) mode `mode` (R_OK, W_OK, ...). */
int check_path_access(const char *path, unsigned int mode);

/* ---- directories and files ---- */

/* mkdir(path, mode); an already existing entry counts as success. */
int make_dir(const char *path, mode_t mode);
/* Creates path and every missing parent (mode 0 means 0700). Existing
 * directories are fine, so running it twice succeeds twice. */
int make_dir_include_parent(const char *path, mode_t mode);
/* rmdir(path); a missing directory counts as success. */
int remove_dir(const char *path);
/* Removes a tree with "rm -rf", the path escaped for the shell. NULL: -1;
 * "": 0 and nothing runs. -1 when the command fails. */
int remove_dir_recurive(const char *path);
/* unlink(path); a missing file counts as success. */
int remove_file(const char *path);
/* 0 when path exists; else creates it exclusively with `mode` (callers pass
 * 0700), empty. -1 when it can be neither found nor created. */
int create_file_if_absent(const char *path, mode_t mode);
/* Proves that `dir` accepts `count` bytes: writes them as zeros to dir/name,
 * a file it creates itself, then closes and removes it whatever happened.
 * An existing entry of that name (file or link) is never followed, truncated
 * or removed: it answers -1 (logged). 0 / -1. */
int check_dir_is_writable(const char *dir, const char *name, unsigned long long count);
/* Bytes allocated on disk for path (512-byte blocks x 512, not the length)
 * into *size; on failure *size is 0 and -1 is returned. */
int get_file_alloc_size(unsigned long long *size, const char *path);
/* symlink(target, link). When link already exists: 0 if it already points
 * to target, -2 if it points elsewhere (it is left unchanged), -1 if it is
 * not a readable link. Any other failure: -1. */
int create_symlink(const char *target, const char *link);

/* ---- commands ---- */

/* Runs fmt with `arg` through the shell. fmt holds one %s outside any quotes
 * (and otherwise only %%); `arg` takes its place escaped and inside double
 * quotes, one shell word that never runs. 0 when the command exits 0; -1
 * when it fails or the format is refused. */
int run_system_cmd(const char *fmt, const char *arg);
/* Runs cmd with system() up to `tries` times until it exits 0, waiting a
 * random 0..max_delay_us-1 microseconds before each retry (when max_delay_us
 * >= 2), so that several processes failing on one resource do not retry in
 * lock-step. Returns the last raw system() status; 0 when tries <= 0 (nothing
 * runs). cmd is run as given: it must not carry unescaped data. */
int process_system_cmd_mt(const char *cmd, int tries, int max_delay_us);

/* ---- the cross-process lock ---- */

/* Takes the lock of `key`: gets (or creates with permission 0666 and value
 * 1) the one-semaphore set of key, stores its id in *sem_id and waits for
 * it (SEM_UNDO, so a crashed holder releases it). 0 taken; -1 the semaphore
 * could not be got or created; -2 the wait failed. */
int sem_P(int *sem_id, key_t key);
/* Releases the lock: with no process waiting, removes the semaphore (and
 * stores -1 in *sem_id) so the next sem_P starts afresh at 1; otherwise (or
 * if removal fails) posts it. 0 / -2 when posting fails. */
int sem_V(int *sem_id, key_t key);

/* ---- prealloc processes ---- */

/* Sends SIGTERM to the prealloc process of LUN `lun_name`, whose pid is in
 * "/var/run/prealloc_<lun_name>.pid"; nothing when it is not running. */
void stop_prealloc(const char *lun_name);
/* 1 when a prealloc process shows in "ps", 0 when none, -1 when ps cannot run. */
int check_any_prealloc_running(void);
/* "killall prealloc". */
void kill_all_prealloc(void);

/* ---- text checks ---- */

/* 0 when text is 1..223 characters of a-z, 0-9, '-', '.', ':' (upper case
 * is refused), else -1. */
int check_name_chars_valid(const char *text);
/* Parses IPv6 text into 16 network-order bytes (groups in hexadecimal, "::"
 * zero-filled). Group contents are not validated and an empty last group is
 * ignored, but a group that would fall outside the 16 bytes fails. -1 for NULL, fewer than 3 characters or too
 * many groups; out is then unspecified. */
int ipv6_text_to_bytes(unsigned char out[16], const char *text);
/* 1 when text is a link-local unicast address (fe80::/64: first byte 0xfe,
 * next byte's top two bits 10, bytes 2..7 zero), 0 when not, -1 when it does
 * not parse. */
int is_ipv6_link_local(const char *text);

#ifdef __cplusplus
}

#include <cstdio>
#include <functional>
#include <memory>
#include <string>
#include <string_view>

#include "common/korvadm_str.h"

namespace korv {
/* A stdio stream closed when it goes out of scope. */
struct file_closer {
    void operator()(std::FILE *f) const { std::fclose(f); }
};
using file_ptr = std::unique_ptr<std::FILE, file_closer>;
}  // namespace korv
#endif

#endif
