/* Traffic-control rule store of the appliance platform: one rule file per
 * adapter inside a configuration directory, and the reload that applies a
 * directory's rules.
 *
 * Error stack codes recorded by the rule store (OLIBCErrGet):
 *   0x0016  a NULL argument, an invalid adapter name or directory path (".."),
 *           a close under another directory or adapter than the open, or an
 *           ORVI_TC_APPLY other than "kernel" and "plan"
 *   0x0200  out of memory
 *   0x0201  a directory or rule file cannot be opened, read or written
 *   0x0300  a rule file is malformed or truncated
 *   0x0301  a rule's ceiling exceeds its device's upper bound (reload -2)
 *   0x0302  the guaranteed rates of a device exceed its upper bound (reload -3)
 *   0x0303  a rule's source is not "all", an IPv4/IPv6 address or prefix, or a MAC
 *   0x0304  a rule names an unknown service or its port list is unusable
 *   0x0305  a device would need more filters than the store allows
 *   0x0306  applying a batch with tc failed
 *   0x0307  an enabled rule's rates are unusable (minrate below 1, maxrate
 *           negative, or a non-zero maxrate below minrate)
 *
 * Reload results: 0 all applied; -2 (0x0301) and -3 (0x0302) the bound
 * checks; -1 a directory or file that cannot be read, a malformed file,
 * unusable rates or a bad ORVI_TC_APPLY; the generator's own negative value
 * (never -2 or -3) when it refuses a rule or tc fails.
 */
#ifndef ORVI_FW_TC_H
#define ORVI_FW_TC_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

#define ORVI_TC_ERR_FORMAT 0x0300
#define ORVI_TC_ERR_CEIL 0x0301
#define ORVI_TC_ERR_RATESUM 0x0302
#define ORVI_TC_ERR_SOURCE 0x0303
#define ORVI_TC_ERR_PORTS 0x0304
#define ORVI_TC_ERR_TOOMANY 0x0305
#define ORVI_TC_ERR_APPLY 0x0306
#define ORVI_TC_ERR_RATE 0x0307

typedef enum _tag_orvi_firewall_protocol_ {
  ORVI_FW_PROTO_TCP = 1,
  ORVI_FW_PROTO_UDP = 2,
  ORVI_FW_PROTO_ALL = 3,
  /* Stored records may hold any 32-bit number; these bounds make every
     int32 value a valid value of the type, so reading one is defined. */
  ORVI_FW_PROTO_INT32_MIN_ = -2147483647 - 1,
  ORVI_FW_PROTO_INT32_MAX_ = 2147483647
} _tag_orvi_firewall_protocol_;

typedef struct _tag_orvi_firewall_tc_rule_ {
  int32_t id;
  int32_t enabled;
  char source[128];
  char* ports;
  _tag_orvi_firewall_protocol_ protocol;
  int32_t minrate;
  int32_t maxrate;
  int32_t ipDirection;
  struct _tag_orvi_firewall_tc_rule_* next;
} TcRule;

typedef struct TcRuleList {
  char adapter[16];
  TcRule* rules;
  /* store's own fields follow */
  int32_t count;
} TcRuleList;

typedef struct TcRuleFile TcRuleFile; /* opaque rule file handle */

int ORVIFwTcRuleGetByAdapter(const char* dir, const char* adapter, TcRuleList** list);
void ORVIFwTcRulesFreeByAdapter(TcRuleList* list);
TcRuleFile* ORVIFwTcRuleOpen(const char* dir, const char* adapter);
int ORVIFwTcBufRuleInit(TcRule** rule);
int ORVIFwTcRuleWrite(TcRuleFile* file, const TcRule* rule);
void ORVIFwTcBufRulesFree(TcRule* rule);
int ORVIFwTcRuleClose(const char* dir, TcRuleFile* file, const char* adapter);
int ORVIFwTcRuleReload(const char* dir);

/* Not used by the module: the tc batch that a reload of dir would apply to
 * the device of adapter, after the same checks. *batch receives a heap
 * string the caller frees; 0, or negative with an error recorded. */
int ORVIFwTcRulePlan(const char* dir, const char* adapter, char** batch);

#ifdef __cplusplus
}
#endif

#if defined(__SIZEOF_POINTER__) && __SIZEOF_POINTER__ == 4
#ifdef __cplusplus
#define ORVI_TC_STATIC_ASSERT static_assert
#else
#define ORVI_TC_STATIC_ASSERT _Static_assert
#endif
#include <stddef.h>
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, id) == 0, "TcRule.id");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, enabled) == 4, "TcRule.enabled");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, source) == 8, "TcRule.source");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, ports) == 136, "TcRule.ports");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, protocol) == 140, "TcRule.protocol");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, minrate) == 144, "TcRule.minrate");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, maxrate) == 148, "TcRule.maxrate");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, ipDirection) == 152, "TcRule.ipDirection");
ORVI_TC_STATIC_ASSERT(offsetof(TcRule, next) == 156, "TcRule.next");
ORVI_TC_STATIC_ASSERT(offsetof(TcRuleList, rules) == 16, "TcRuleList.rules");
#endif

#endif
