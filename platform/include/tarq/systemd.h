/* Service units: start, stop and status.
 *
 * Where the machine was started by systemd, units are its units. Elsewhere, and below a root folder
 * (see root_path.h), a unit is a section of /usr/tarq/etc/tarqsystemd.conf:
 *
 *     [zel_daemon]
 *     command="/usr/sbin/zel_daemon --config '/etc/a file'"
 *     stop_seconds="30"
 *
 * The command is started in the background in a session of its own; its process number is in
 * /var/run/<unit>.pid.
 *
 * `unit` is a unit's name: letters, digits and "_-.:@", not beginning with ".". Without a suffix it
 * is a service. C linkage; a failing operation sets the error code of tarq/core.h:
 * TARQ_ERR_BAD_PARAMETER for a name that is none, TARQ_ERR_SERVICE when the manager refuses or
 * cannot be reached, the command cannot be run or does not end (errno says why where it is known).
 * Any thread may call.
 */
#pragma once

#ifdef __cplusplus
extern "C" {
#endif
#pragma GCC visibility push(default)

/* 1 when the unit is active, 0 when it is not (also one that is still starting, or that nobody
 * knows), negative when the manager cannot be asked. */
int TARQSystemdActiveStatusGet(const char* unit);

/* Starts the unit and waits until it is started. 1: it is active now, also when it was before. 0:
 * it failed; with TARQ_ERR_SERVICE_BUSY the unit is being started already by someone else, and
 * nothing was done. Without systemd a unit that is not configured gives TARQ_ERR_NO_SECTION or
 * TARQ_ERR_NO_KEY. */
int TARQSystemdStart(const char* unit);

/* Stops the unit and waits until it has ended. 1: it is inactive now, also when it was before. 0:
 * it failed. Without systemd the process is sent SIGTERM, and after `stop_seconds` (30 when not
 * set) SIGKILL with its session's other processes. */
int TARQSystemdStop(const char* unit);

#pragma GCC visibility pop
#ifdef __cplusplus
}
#endif
