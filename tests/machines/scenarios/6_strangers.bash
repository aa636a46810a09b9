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
