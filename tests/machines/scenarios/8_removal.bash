# The packages go, and what people have stays.
# shellcheck shell=bash

# system_files MACHINE: what is on the system's own disk, without what people make and what any package changes.
system_files() {
    at "$1" find / -xdev -regextype egrep \
        -regex '/(srv|home|root|tmp|var/(tmp|cache|lib/(dpkg|apt|systemd)|log/(apt|journal)|log/dpkg.log)|etc/sub[ug]id-)' -prune -o -print | LC_ALL=C sort
}

removal_keeps_everything() {  # scenario
    at client apt-get remove -y zel-client
    at server apt-get remove -y zel-server
    fails at client test -e /usr/bin/zelctl
    at client bash -c 'date >/srv/photos/while_removed'
    local name
    for name in client server; do
        give_packages "$name" "$packages"
        at "$name" bash -c "apt-get install -y /root/packages/zel-${name}_*.deb"
    done
    until_true 60 in_step
}

# Of the client and the server nothing is left but what people have written and the user of the copies.
purge_leaves_what_people_made() {  # scenario
    at server mkdir -p /usr/tarq/etc/zel_server/admin.d
    at server bash -c 'echo "[mine]" >/usr/tarq/etc/zel_server/admin.d/mine.conf'
    at client bash -c 'printf "[device]\nserial=\"NAS\"\n" >/usr/tarq/etc/tarqsdk.conf'
    local name before
    before=$(tree server /srv/copies/photos)
    for name in client server; do
        at "$name" apt-get purge -y "zel-$name" libzel
        system_files "$name" | comm -13 "$MACHINES/before-$name" - >"$MACHINES/left-$name"
    done
    is "$(cat "$MACHINES/left-client")" $'/usr/tarq\n/usr/tarq/etc\n/usr/tarq/etc/tarqsdk.conf'
    is "$(cat "$MACHINES/left-server")" \
        $'/usr/tarq\n/usr/tarq/etc\n/usr/tarq/etc/zel_server\n/usr/tarq/etc/zel_server/admin.d\n/usr/tarq/etc/zel_server/admin.d/mine.conf'
    is "$(tree server /srv/copies/photos)" "$before"
}
