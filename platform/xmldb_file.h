// SPDX-License-Identifier: Apache-2.0
/* Whole-file reads and crash-safe whole-file writes, shared by the database
 * service (loading and saving the tree) and the utility calls (copying the
 * saved file). Both take regular files only, up to kFileMax bytes. */
#ifndef PLATFORM_XMLDB_FILE_H
#define PLATFORM_XMLDB_FILE_H

#include <cstddef>
#include <string>
#include <string_view>

namespace xmldb {

// Largest file read or written: it holds the whole tree, secrets included.
inline constexpr size_t kFileMax = 64u << 20;

// Writes content to path atomically: a new temporary "NAME.tmp.PID.RANDOM"
// in the same directory (O_CREAT|O_EXCL|O_NOFOLLOW, mode 0600), fsync, rename
// over path, fsync of the directory. A crash leaves the old or the new file,
// never a mix. The result is a regular file of mode 0600 whatever stood at
// path before; a symbolic link there is replaced, never followed. Refused
// (false with err, nothing replaced) when content exceeds kFileMax or path
// names something other than a regular file or a link.
bool write_file_atomic(const std::string &path, std::string_view content, std::string &err);

// True when name is a temporary of write_file_atomic for the file called
// base; *writer is then the pid of the process that created it.
bool is_temporary_of(std::string_view base, std::string_view name, long *writer);

// Reads a whole regular file of at most kFileMax bytes (FIFOs, devices and
// directories are refused without blocking). False with err otherwise.
bool read_file(const std::string &path, std::string &out, std::string &err);

// Creates dir and its missing parents (mode 0755). False when dir is not a
// directory afterwards.
bool make_dirs(const std::string &dir);

}  // namespace xmldb

#endif
