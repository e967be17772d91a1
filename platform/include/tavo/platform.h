/* The appliance platform interfaces that libfileindex calls. */
#ifndef TAVO_PLATFORM_H
#define TAVO_PLATFORM_H

#ifdef __cplusplus
extern "C" {
#endif

/* A share of the share database. The name is the first member and the directory
 * (absolute, on a volume) the third; the rest belongs to the platform. */
typedef struct _tag_TAVOSHARE {
  char* szName;
  char* szComment;
  char* szPath;
  int blReadOnly;
  int blEncrypted;  /* encrypted and currently locked */
  int blEncryption; /* uses encryption */
  int blRecycleBin;
} TAVOSHARE, *PTAVOSHARE;

/* Share database. Negative results mean failure; the reason is in VLIBCErrGet(). */
int TAVOShareGet(const char* szName, PTAVOSHARE* ppShare);
void TAVOShareFree(PTAVOSHARE pShare);
int TAVOShareNamePathGet(const char* szFullPath, char* szName, int cbName, char* szPath, int cbPath);
int TAVOShareIsShareRecycle(const char* szFullPath);
int VLIBShareIsEncryptedGet(PTAVOSHARE pShare, int* pblEncrypted);
int VLIBShareIsEncryptionGet(PTAVOSHARE pShare, int* pblEncryption);
int VLIBShareIsReadOnlyGet(PTAVOSHARE pShare, int* pblReadOnly);

/* File-system facts. */
int TAVOGetFSType(const char* szPath, int flag);
int TAVOFSIsRemoteFS(int fsType);
int TAVOFSIsImageFS(int fsType);
int TAVOFSDirIsMntPoint(const char* szPath);
int VLIBFhsPathInSnapshot(const char* szPath, int* pblInSnapshot);
int TAVOEAIsHiddenDir(const char* szName);
int TAVOEAMKDir(int flag, const char* szPath);

/* Quota: non-zero when cbSize more bytes fit for the user on the directory's volume. */
int TAVOQuotaIsEnough(unsigned int uid, const char* szPath, unsigned long long cbSize);

/* Services and Samba. */
int VLIBServiceStart(const char* szService, int flag);
int VLIBServiceStop(const char* szService, int flag);
int VLIBServiceRestart(const char* szService);
int TAVOSMBIsEnableSpotlight(void);
int TAVOSMBSetSpotlight(int blEnable);

/* Program execution: runs the program with the non-null arguments and waits. */
int VLIBCExec(const char* szProgram, const char* szArg1, const char* szArg2, const char* szArg3,
              const char* szArg4);
int VLIBCExecv(const char* szProgram, char* const argv[], int flag);

/* The platform error channel. */
int VLIBCErrGet(void);
void VLIBCErrSetEx(int code, const char* szFile, int line);
const char* VLIBCErrorGetFile(void);
int VLIBCErrorGetLine(void);

/* Unicode comparison without regard to letter case, like strcmp. */
int VLIBCUnicodeUTF8StrCaseCmp(const char* a, const char* b);

#ifdef __cplusplus
}
#endif

#endif
