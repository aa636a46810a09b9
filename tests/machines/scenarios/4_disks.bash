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

# deposited TEXT: the last that a client has left.
deposited() {
    is "$(at server bash -c 'tail -n +4 "$(ls -t /usr/tarq/etc/zel_server/deposits/alice/*/[0-9]* | head -n 1)"')" "$1"
}

# A client whose disks are lost, that of its system as well, has all back with the packages and one command.
client_lost() {  # scenario
    local configuration before
    configuration=$(at client zelctl export)
    until_true 60 deposited "$configuration"
    until_true 60 in_step
    before=$(tree client /srv/photos)
    machine down client kill
    machine anew client
    echo "10.77.0.2 nas2" >>"$MACHINES/root/client/etc/hosts"
    find "$MACHINES/disk/photos" -mindepth 1 -delete
    machine up client  # its disk is not there yet
    give_packages client "$packages"
    at client bash -c 'apt-get install -y /root/packages/libzel_*.deb /root/packages/zel-client_*.deb'
    ends_with 1 typed client 'zelctl recover --server nas2 --user alice --from client'
    is "$(of_task photos .status)" 3
    is "$(at client ls -A /srv)" ""
    sleep 5  # what it has by now is deposited as well
    machine down client
    machine up client --disk photos=/srv/photos
    typed client 'zelctl recover --server nas2 --user alice'
    is "$(tree client /srv/photos)" "$before"
    is "$(at client zelctl export)" "$configuration"
    at client bash -c 'date >/srv/photos/date'
    until_true 60 in_step
    at client zelctl doctor
    until_true 60 deposited "$configuration"
}
