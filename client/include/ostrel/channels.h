/* Driver channels: counters that the reporting service reads when a session starts
 * and stops. One file of counters for each group and subgroup, mapped into memory;
 * updating one is a single atomic instruction, safe on an audio thread.
 *
 *     ostrel_channels *channels;
 *     ostrel_counter *underruns;
 *     if (ostrel_channels_open("Speaker", "Stats", 0, &channels) == 0 &&
 *         ostrel_channels_counter(channels, "underruns", &underruns) == 0) {
 *       ostrel_channels_add(underruns, 1);
 *     }
 */
#ifndef OSTREL_CHANNELS_H
#define OSTREL_CHANNELS_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define OSTREL_CHANNELS_PUBLIC __attribute__((visibility("default")))

/** Most bytes of a group's, a subgroup's and a counter's name, in UTF-8. */
#define OSTREL_CHANNELS_MOST_GROUP_BYTES 39
#define OSTREL_CHANNELS_MOST_NAME_BYTES 55
/** Most counters of one file, and what a capacity of 0 stands for. */
#define OSTREL_CHANNELS_MOST_COUNTERS 16384
#define OSTREL_CHANNELS_DEFAULT_COUNTERS 256

/** The counters of one group and subgroup. */
typedef struct ostrel_channels ostrel_channels;

/** One counter; valid until its channels are closed. */
typedef struct ostrel_counter ostrel_counter;

/** Opens the counters of a group and subgroup in the "channels" of
 * $RUNTIME_DIRECTORY, else beside $OSTREL_REPORTING_SOCKET, else in the usual
 * runtime directory, making them with room for `capacity` counters when there are none
 * yet. Several openers, of one process or of several, share the counters; those
 * that are there keep their values and their capacity. `group` or `subgroup` may
 * be NULL or empty.
 *
 * Returns 0 or an errno value: EINVAL for a name that is too long or no UTF-8, or
 * a capacity that is too large; EACCES when the counters are another user's, whom
 * this process cannot trust to leave the file whole. Blocks on the file system. */
OSTREL_CHANNELS_PUBLIC int ostrel_channels_open(const char* group, const char* subgroup,
                                                uint32_t capacity,
                                                ostrel_channels** channels);

/** As ostrel_channels_open, in another directory, which is made when missing. */
OSTREL_CHANNELS_PUBLIC int ostrel_channels_open_in(const char* directory,
                                                   const char* group,
                                                   const char* subgroup,
                                                   uint32_t capacity,
                                                   ostrel_channels** channels);

/** The counter of that name, made with the value 0 when there is none yet. Any
 * thread. Returns 0 or an errno value: EINVAL for a name that is empty, too long
 * or no UTF-8, ENOSPC when there is no room. Waits for other processes that add
 * counters: not for an audio thread. */
OSTREL_CHANNELS_PUBLIC int ostrel_channels_counter(ostrel_channels* channels,
                                                   const char* name,
                                                   ostrel_counter** counter);

/** Adds to a counter, wrapping around. Any thread, audio threads and signal
 * handlers included: no lock, no system call, no allocation. */
OSTREL_CHANNELS_PUBLIC void ostrel_channels_add(ostrel_counter* counter, int64_t amount);

/** Sets a counter. As ostrel_channels_add. */
OSTREL_CHANNELS_PUBLIC void ostrel_channels_set(ostrel_counter* counter, int64_t value);

/** A counter's value now. As ostrel_channels_add. */
OSTREL_CHANNELS_PUBLIC int64_t ostrel_channels_get(const ostrel_counter* counter);

/** Ends the use of the channels and their counters. The file stays, with its
 * values. NULL is ignored. */
OSTREL_CHANNELS_PUBLIC void ostrel_channels_close(ostrel_channels* channels);

#ifdef __cplusplus
}
#endif

#endif
