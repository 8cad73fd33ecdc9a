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
 *   0x0204  a key is not in the key file
 *   0x0205  a key's value does not fit the caller's buffer
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
#define OLIBC_ERR_NOKEY 0x0204
#define OLIBC_ERR_RANGE 0x0205

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

/* Every call below that fails records an error on the calling thread's stack.
 * Functions returning int answer 0 (or a length) on success and a negative
 * value on failure, except OLIBCSzListRemove. */

SzList* OLIBCSzListAlloc(int size); /* size < 8 gives room for 8 items */
void OLIBCSzListFree(SzList* list);
char* OLIBCSzListGet(SzList* list, int index);        /* NULL out of range */
int OLIBCSzListPush(SzList** list, const char* item); /* 0 on success; may move the list */
int OLIBCSzListRemove(SzList* list, int index);       /* non-zero on success */
/* Joins the items with sep into *buf, enlarging it with realloc (a NULL *buf
 * is allocated) and updating *size when the text does not fit. On failure the
 * caller's buffer is left as it was. */
int OLIBCSzListJoin(SzList* list, const char* sep, char** buf, int* size);
/* Appends the text between any of the separator characters: "" gives no
 * item, "80,,443" gives "80", "", "443" and "80," gives "80", "". On failure
 * nothing is appended. */
int OLIBCStrTok(const char* text, const char* seps, SzList** list);
int OLIBCStrTrimSpace(char* text, int flags); /* flags unused, pass 0 */
/* Value of the first "key=value" line of the file at path (under the appliance
 * root). Blanks around "=" and one pair of surrounding quotes are dropped;
 * lines starting with "#" are comments. Returns the value's length (0 for an
 * empty value); negative when the file cannot be read, the key is missing or
 * the value does not fit in size bytes (never a cut value). flags unused. */
int OLIBCFileGetKeyValue(const char* path, const char* key, char* buf, int size, int flags);
/* Runs program (a path, not searched in PATH, never through a shell) with up
 * to three arguments, then NULL, and waits for it. Arguments that begin with
 * "/" are resolved under the appliance root; the program path is not.
 * Returns 0 when it exits 0, -1 when it cannot be started (exit status 127
 * counts as that), -2 when it exits non-zero, -3 when a signal kills it. */
int OLIBCExec(const char* program, ...);
/* Appends, in name order, every interface of the appliance root's
 * sys/class/net that has a bridge/ directory. option is not used (the module
 * passes 3). On failure nothing is appended. */
int OLIBNetEnumBridge(SzList** list, int option);

#ifdef __cplusplus
}
#endif

#endif
