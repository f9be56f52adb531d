/*
 * ox_mss.h - the security support interface (libox_mss) that libox_idm uses
 * for its identity mapping files, and the inspection calls of this stand-in.
 *
 * File locks are open-file-description locks (F_OFD_SETLK): two descriptors
 * of one process, even on one thread, hold independent locks, and closing one
 * descriptor never drops another's lock.  They conflict with whole-file
 * flock()s and fcntl() locks of other processes as the kernel defines.
 */
#ifndef OX_MSS_H
#define OX_MSS_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

/* Opens an existing regular file read-only (close-on-exec), without ever
 * waiting on what is found at the path.  0 and *fd; 12 access denied; 21 no
 * such file; 22 not a regular file (FIFO, device, directory, socket, or a
 * symbolic link to one of them or to nothing); 6 out of memory; 23 any other
 * failure. */
int sec__open_file(const char *path, int flags, int *fd);
/* Shared lock on the whole file, waiting a bounded time (default 5 s).
 * 0 locked; 30 not obtained in time; 23 other failure. */
int sec__readlock_file(int fd, const char *caller);
/* Releases the lock; 0, or 23. */
int sec__unlock_file(int fd, const char *caller);
/* Closes *fd and sets it to -1; 0, or 23. */
int sec__close_file(int *fd);
/* Modification time in whole seconds (low 32 bits), of the link's target.
 * 0; 21 no such file; 12 access denied; 23 other failure.  A symbolic link
 * to nothing is present (0, with the link's own time): opening it fails. */
int sec__time_file(const char *path, uint32_t *mtime);

/* ---- inspection interface of the stand-in ---- */
void mssx_set_lock_wait_ms(int ms);          /* bounded wait of sec__readlock_file */
/* Force the result of the next calls for `path` (NULL: any path); 0 stops. */
void mssx_force_open(const char *path, int result);
void mssx_force_readlock(int result);
void mssx_force_time(const char *path, int result);
long mssx_locks_held(void);
/* Non-zero: sec__open_file hands over any file that opens, unchecked, as a
 * platform library that does not check would. */
void mssx_accept_any_file(int on);                  /* locks taken and not yet released */
void mssx_reset(void);

#ifdef __cplusplus
}
#endif
#endif
