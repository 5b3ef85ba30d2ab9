/**
 * @file quarn_d_memps.h
 * @brief The daemon's own memory, measured as its proportional share (PSS).
 *
 * Main thread only: the measurement keeps one buffer for the process.
 */
#ifndef QUARN_D_MEMPS_H
#define QUARN_D_MEMPS_H

#include <sys/utsname.h>

#include <cstdint>
#include <string>

/** Above this many kilobytes the daemon asks to be started anew. */
inline constexpr int kMempsCeilingKb = 20480;

/** One mapping, or several in a row of one file; sizes are kilobytes. */
struct mapinfo {
  mapinfo *next = nullptr;
  std::uint64_t start = 0;
  std::uint64_t end = 0;
  int size = 0;
  int rss = 0;
  int pss = 0;
  int shared_clean = 0;
  int shared_dirty = 0;
  int private_clean = 0;
  int private_dirty = 0;
  std::string perm; /**< four characters: "r-xp" */
  std::string name; /**< path or label; "[anon]" without one */
};

/** Where the measurement gets its facts; a test puts others in their place. */
struct memps_source {
  int (*kernel_name)(struct utsname *name);
  /** Open a process's "smaps" for reading; -1 when it cannot be read. */
  int (*open_smaps)(int pid);
};
extern memps_source memps_facts;

/** Lines that this kernel is known to print after the seven counters of a mapping. */
extern int smaps_lines;

/**
 * Measure, and above the ceiling ask for a restart, which is dropped while work is going on.
 * No part of the daemon calls it.
 */
void check_memps_status();
/** Total PSS of a process in kilobytes; 0 when nothing could be read. */
int get_memory_usage(int pid);
/** A process's mappings, the last one first; released with free_maps(). Null when there are none.
 */
mapinfo *load_maps(int pid);
/** Release a list; null is accepted. */
void free_maps(mapinfo *maps);
/**
 * Parse one mapping and move the cursor behind it. The text is changed.
 * @param extra as smaps_lines: how long an entry is at least expected to be. An
 *              entry ends where the next one begins, however many lines the
 *              kernel prints.
 * @return a record that the caller deletes; null at the end of the text or,
 *         with "mi get error" on standard output, for a malformed entry
 */
mapinfo *read_mapinfo(char **cursor, int extra);
/** Set smaps_lines for the running kernel. */
void check_kernel_version();

#endif
