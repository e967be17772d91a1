/* C interface of libfileindex. */
#ifndef FILEINDEX_C_H
#define FILEINDEX_C_H

#ifdef __cplusplus
extern "C" {
#endif

/* Writes the share's queue file path into the buffer (cut as snprintf does);
 * returns its length, or -1. */
int FILEIDXQueuePathGet(const char* szName, char* szOutQueuePath, int cbOutLen);
/* Writes the share's index database path into the buffer and makes the directory;
 * returns its length, or -1. */
int FILEIDXDBPathGet(const char* szName, char* szOutDBPath, int cbOutLen);
/* 1 when the share path lies in an indexed folder, else 0. */
int FILEIDXIsPathIndexed(const char* path);
/* 1 when the full path lies in an indexed folder, else 0. */
int FILEIDXIsFullPathIndexed(const char* full_path);
/* 1 when the share holds an indexed folder, else 0. */
int FILEIDXIsShareIndexed(const char* share);

#ifdef __cplusplus
}
#endif

#endif
