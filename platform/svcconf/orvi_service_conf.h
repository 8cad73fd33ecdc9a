/* Service configuration helpers of the appliance platform. */
#ifndef ORVI_SERVICE_CONF_H
#define ORVI_SERVICE_CONF_H

#ifdef __cplusplus
extern "C" {
#endif

/* 1 when port is the plain decimal text of a number from 0 to 65535, else 0.
 * Only ASCII digits are accepted: no sign, no blanks, no base prefix. Leading
 * zeros are accepted ("080" is 80) as long as the text has at most five
 * digits, so "00080" passes and "000080" does not. */
int ORVIServiceConfPortsCheck(const char* port);

#ifdef __cplusplus
}
#endif

#endif
