/* C utility library of the appliance platform: error stack, string lists,
 * string helpers, key file reader, program execution, bridge enumeration.
 *
 * Error stack codes recorded by this library (OLIBCErrGet):
 *   0x0000  nothing recorded
 *   0x0016  EINVAL-like: a NULL or malformed argument
 *   0x0200  out of memory (also recorded by callers for their own buffers)
 *   0x0201  a file or directory could not be opened or read
 *   0x0202  a program could not be started
 *   0x0203  a program exited non-zero or was killed by a signal
 *   0xD900  the appliance is not in router mode (recorded by callers)
 */
#ifndef ORVI_OLIBC_H
#define ORVI_OLIBC_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define OLIBC_ERR_INVAL 0x0016
#define OLIBC_ERR_NOMEM 0x0200
#define OLIBC_ERR_IO 0x0201
#define OLIBC_ERR_SPAWN 0x0202
#define OLIBC_ERR_EXIT 0x0203

/* The item count is the second 32-bit word: callers read it directly. */
typedef struct SzList {
  int32_t size;  /* capacity of items */
  int32_t count; /* number of items */
  char** items;
} SzList;

int OLIBCErrGet(void);
const char* OLIBCErrorGetFile(void); /* never NULL: "" when nothing recorded */
int OLIBCErrorGetLine(void);
void OLIBCErrSetEx(int code, const char* file, int line);

SzList* OLIBCSzListAlloc(int size);
void OLIBCSzListFree(SzList* list);
char* OLIBCSzListGet(SzList* list, int index);           /* NULL out of range */
int OLIBCSzListPush(SzList** list, const char* item);    /* 0 on success; may move the list */
int OLIBCSzListRemove(SzList* list, int index);          /* non-zero on success */
int OLIBCSzListJoin(SzList* list, const char* sep, char** buf, int* size);
int OLIBCStrTok(const char* text, const char* seps, SzList** list);
int OLIBCStrTrimSpace(char* text, int flags);
int OLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size, int flags);
int OLIBCExec(const char* program, ...); /* up to three args, then NULL */
int OLIBNetEnumBridge(SzList** list, int option);

#ifdef __cplusplus
}
#endif

#endif
