# A local user without rights who came first, and looks at everything.
# shellcheck shell=bash

stranger() {
    local name
    for name in client server; do at "$name" bash -c 'id mallory >/dev/null || useradd mallory'; done
}

nothing_to_see() {  # scenario
    local name
    stranger
    at client bash -c 'install -m 600 /dev/null /srv/photos/secret; echo "for my eyes" >>/srv/photos/secret'
    until_true 20 in_step
    fails at_as server mallory cat /srv/copies/photos/secret
    fails at_as client mallory zelctl status
    fails at_as client mallory zelctl task list --json
    in_a_push
    # In what the programs wrote, and in the processes' argument lists and environments.
    for name in client server; do
        fails at_as "$name" mallory grep -rqsF -e "$password" /usr/tarq /run /tmp /var /srv/copies /proc/[0-9]*/{cmdline,environ}
    done
    until_true 30 in_step
}

# He has made the scratch folder and the semaphore of the programs before they come up.
nothing_to_hold() {  # scenario
    stranger
    local name
    for name in client server; do
        at "$name" bash -c 'ipcrm --semaphore-key 0x2980298 2>/dev/null || true'
        at_as "$name" mallory perl -e 'semget(0x2980298, 1, 01666) // die $!'
    done
    at client rm -rf /tmp/ZEL
    at_as client mallory mkdir -m 700 /tmp/ZEL
    at client systemd-tmpfiles --create  # as each boot does, and the package's installation
    at client systemctl restart zel_daemon
    at client bash -c 'date >/srv/photos/date'
    until_true 20 in_step
    typed client "zelctl push photos --server nas2 --user alice"
    at server zel_server status
}
