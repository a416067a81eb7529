// SPDX-License-Identifier: Apache-2.0
/* Logging: one prefixed line on standard output per statement, filtered by
 * one process-wide debug level.
 *
 *   DBG(level, "format", args...)
 *
 * prints "(unit:function:line):" followed by the formatted message and one
 * newline, when the debug level is at least `level`. Standard output is
 * flushed after the prefix (even when nothing printed) and after the message,
 * so the lines stay in order with the output of shell commands we run.
 * `unit` is the source file's name without directory or extension, or
 * KORV_LOG_UNIT where a unit split into several files defines it (in its
 * _internal.h, with #undef first), so every file logs under the unit's name.
 * Level 0 is errors, 1 details, 2 progress, 3 and 4 traces. A negative debug
 * level silences everything. */
#ifndef KORVADM_LOG_H
#define KORVADM_LOG_H

#ifdef __cplusplus
extern "C" {
#endif

/* The process-wide debug level; 0 until the daemon reads the stored one. */
extern int g_korv_debug_level;

void korv_log(int level, const char *file, const char *func, int line, const char *fmt, ...)
    __attribute__((format(printf, 5, 6)));

#ifdef __cplusplus
}
#endif

#ifndef KORV_LOG_UNIT
#define KORV_LOG_UNIT __FILE__
#endif

#define DBG(level, ...) korv_log((level), KORV_LOG_UNIT, __func__, __LINE__, __VA_ARGS__)

/* For a helper shared by several operations: the line names `func`, the
 * operation it works for, which is the name an operator knows. */
#define DBG_AS(func, level, ...) korv_log((level), KORV_LOG_UNIT, (func), __LINE__, __VA_ARGS__)

#endif
