/* Who this device is: serial number and host name.
 *
 * C linkage; a failing operation sets the error code of tarq/core.h. Any thread may call.
 *
 * Both can be set in /usr/tarq/etc/tarqsdk.conf (below the root folder, see root_path.h), section
 * "device", keys "serial" and "hostname"; what is set there stands before what the hardware and the
 * kernel say.
 */
#pragma once

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* The longest serial number that is given, in bytes without the terminator. */
#define TARQ_SERIAL_NUMBER_MAX 35

/* Writes the device's serial number: printable ASCII without quotes, backquotes and backslashes,
 * blanks only inside.
 *
 * Sources in this order: the configuration file; the firmware's product serial number, then its
 * board serial number; the device tree. The texts that firmware makers leave where a number belongs
 * are none.
 *
 * A number of more than TARQ_SERIAL_NUMBER_MAX bytes is given as its first 18 bytes, "~" and 16
 * hexadecimal digits of its hash, whatever the buffer's size: a device says the same to every
 * caller, and two devices whose numbers begin alike stay two.
 *
 * 0, also for a device without a serial number (the buffer then holds an empty string); negative,
 * with an empty string, when the number does not fit (TARQ_ERR_BAD_PARAMETER; nothing is ever cut
 * off), when the configured one has a character that is not allowed (TARQ_ERR_BAD_PARAMETER), or
 * when a source is there but cannot be read (TARQ_ERR_OPEN_FILE, TARQ_ERR_READ_FILE: the firmware's
 * numbers are readable for root alone). The next source is not asked then, for the device must not
 * be another one to a caller with fewer rights. */
int KAPIGetSerialNumber(char* buffer, int size);

/* Writes the device's host name, cut to 63 bytes, and its terminator into `buffer`, which has room
 * for 64 bytes. 0, or negative, with an empty string, when the device has no name or its name has a
 * quote or a control character (TARQ_ERR_BAD_PARAMETER), or the configuration cannot be read. */
int TARQLnxGetHostname(char* buffer /* 64 */);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif
