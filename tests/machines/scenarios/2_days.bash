# What people do on good days.
# shellcheck shell=bash

changes_are_sent_by_themselves() {  # scenario
    at client bash -euc 'cd /srv/photos
        echo first >"a file"
        mkdir -p new/folder
        echo in it >new/folder/file'
    until_true 20 in_step
    at client bash -euc 'cd /srv/photos
        echo more >>"a file"
        mv new moved
        echo deep >moved/folder/another
        rm -r "2024 summer"'
    until_true 20 in_step
    is "$(last_run photos .reason)" change
    at client zelctl doctor
}

# Owners, modes, lists and attributes come back, though the server's daemon may not set them.
files_come_back_as_they_were() {  # scenario
    at client bash -euc 'mkdir /srv/photos/special
        cd /srv/photos/special
        echo private >private
        chown daemon:mail private
        chmod 4600 private
        setfacl -m u:games:r private
        setfattr -n user.colour -v red private
        ln -s nowhere link
        mkfifo pipe
        touch -d 1999-12-31 old'
    at client zelctl task run photos --wait
    typed client "$(commands_of docs/operations.md "Get files back" \
        "The owning account may read its shares at any time (at the client, as root, so that owners can be set):")"
    is "$(at client rsync -aAXn --itemize-changes --checksum --delete --numeric-ids /srv/photos/ /srv/restored/)" ""
    at client rm -r /srv/restored /srv/photos/special
}

reboots_lose_no_change() {  # scenario
    machine down client
    echo "while it was off" >"$MACHINES/disk/photos/off"
    machine up client --disk photos=/srv/photos
    until_true 30 in_step
    machine down server
    at client bash -c 'echo "while the server was off" >/srv/photos/server'
    until_true 20 task_is photos '.retry_in > 0'
    machine up server --disk copies=/srv/copies
    until_true 60 in_step
}
