/* Whole-file reads and crash-safe whole-file writes, shared by the database
 * service (saving the tree) and the utility calls (copying the saved file). */
#ifndef PLATFORM_XMLDB_FILE_H
#define PLATFORM_XMLDB_FILE_H

#include <string>
#include <string_view>

namespace xmldb {

// Writes content to path atomically: a temporary file in the same directory,
// fsync, rename over path, fsync of the directory. A crash leaves the old or
// the new file, never a mix. False with err on failure (nothing replaced).
bool write_file_atomic(const std::string &path, std::string_view content, std::string &err);

// Reads a whole file. False with err when it cannot be read.
bool read_file(const std::string &path, std::string &out, std::string &err);

// Creates dir and its missing parents (mode 0755). False when dir is not a
// directory afterwards.
bool make_dirs(const std::string &dir);

}  // namespace xmldb

#endif
