/* High availability: whether this device is one half of a pair that acts as one.
 *
 * The state is configured in /usr/tarq/etc/tarqha.conf (below the root folder, see root_path.h),
 * section "pair": running="yes" and mac0="02:00:5e:00:00:01", the address that the pair answers
 * with. C linkage; a failing operation sets the error code of tarq/core.h. Any thread may call.
 */
#pragma once

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* 1 when the device runs as a high-availability pair, else 0: also when nothing is configured, or
 * the configuration cannot be read (the error code is set then). */
int TARQHAIsRunning(void);

/* Writes the pair's shared hardware address number `index`, counted from 0, as text: six lower-case
 * hexadecimal bytes joined by colons. 0, or negative, with an empty string: TARQ_ERR_NO_SECTION or
 * TARQ_ERR_NO_KEY when none of that number is configured; TARQ_ERR_BAD_PARAMETER when an argument
 * is bad, the address does not fit, or what is configured is no unicast hardware address. */
int TARQHAGetMac(int index, char* buffer, int size);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif
