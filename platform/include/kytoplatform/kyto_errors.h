/*
 * Error codes of the platform layer.
 *
 * Every failing platform call records one of these codes, together with the source
 * file and line where the failure was detected, as the calling thread's last error
 * (see KLIBCErrGet in klibc.h).  Calls never print.
 */
#ifndef KYTOPLATFORM_KYTO_ERRORS_H
#define KYTOPLATFORM_KYTO_ERRORS_H

#define KYTO_ERR_NONE 0x0000           /* no error */
#define KYTO_ERR_BAD_PARAMETER 0x0D00  /* NULL pointer, bad size, bad flag or value */
#define KYTO_ERR_OUT_OF_MEMORY 0x0D01  /* an allocation failed */
#define KYTO_ERR_FILE_NOT_FOUND 0x0D02 /* the file or folder does not exist */
#define KYTO_ERR_FILE_OPEN 0x0D03      /* the file exists but cannot be opened */
#define KYTO_ERR_FILE_READ 0x0D04      /* reading failed */
#define KYTO_ERR_FILE_WRITE 0x0D05     /* writing, renaming or creating failed */
#define KYTO_ERR_LINE_TOO_LONG 0x0D06  /* a line of a key=value file is over the limit */
#define KYTO_ERR_EXEC 0x0D07      /* fork, exec or wait failed; or the child died by a signal */
#define KYTO_ERR_PROCESS 0x0D08   /* no such process, or it cannot be signalled */
#define KYTO_ERR_SYSTEM 0x0D09    /* any other system call failed (statfs, mkdir, ...) */
#define KYTO_ERR_NOT_FOUND 0x0D0A /* nothing matched (no volume, no key where one is needed) */

/* To C++ callers every platform call is noexcept: a failure, running out of memory
 * included (KYTO_ERR_OUT_OF_MEMORY), is reported through the last error, never by an
 * exception. */
#ifdef __cplusplus
#define KYTO_NOEXCEPT noexcept
#else
#define KYTO_NOEXCEPT
#endif

#endif
