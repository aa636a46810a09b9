# Disks that are full, missing, or other ones: nothing is lost, and the push goes on when they are right again.
# shellcheck shell=bash

full_server() {  # scenario
    at server bash -c 'fallocate -l "$(($(stat -f -c "%a*%S" /srv/copies) - 4*1024*1024))" /srv/copies/.filler'
    random_file /srv/photos/too_large 12
    until_true 30 task_is photos '.last_status != 0 and .sync_status != 0'
    local status=0
    at client zelctl task run photos --wait || status=$?
    [ "$status" -ne 0 ]
    at server rm /srv/copies/.filler
    at client zelctl task run photos --wait
    in_step
}

server_disk_absent() {  # scenario
    machine down server
    machine up server
    ends_with 4 at client zelctl task run photos --wait
    is "$(at server ls -A /srv/copies)" ""
    machine down server
    machine up server --disk copies=/srv/copies
    at client bash -c 'date >/srv/photos/date'
    until_true 60 in_step
}

# unharmed_by: the share's disk is not there, or another is in its place. Nothing happens to the copy.
unharmed_by() {
    local before
    before=$(tree server /srv/copies/photos)
    machine down client
    machine up client "$@"
    ends_with 3 at client zelctl task run photos --wait
    at client bash -c 'date >/srv/photos/other'
    sleep 5
    is "$(tree server /srv/copies/photos)" "$before"
    machine down client
    machine up client --disk photos=/srv/photos
    at client bash -c 'date >/srv/photos/date'
    until_true 30 in_step
}

client_disk_absent() {  # scenario
    unharmed_by
}

client_disk_swapped() {  # scenario
    machine disk other 16M
    unharmed_by --disk other=/srv/photos
}

# A person may say that another disk is the share from now on.
client_disk_replaced() {  # scenario
    local disk
    machine disk new 16M
    for disk in new photos; do
        machine down client
        machine up client --disk "$disk=/srv/photos"
        ends_with 3 at client zelctl task run photos --wait
        fails in_step
        at client zelctl share confirm photos --yes
        at client zelctl task run photos --wait
        in_step
    done
}
