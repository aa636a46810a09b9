# Packages of another version.
# shellcheck shell=bash

# newer_packages FROM TO: these packages once more, as another version, in a folder of their own.
newer_packages() {
    local from=$1 to=$2 package content=$MACHINES/content
    mkdir -p "$MACHINES/packages-$to"
    for package in "$packages"/*.deb; do
        dpkg-deb --raw-extract "$package" "$content"
        sed -i "/^\(Version\|Depends\|Pre-Depends\|Breaks\):/s/$from/$to/g" "$content/DEBIAN/control"
        dpkg-deb --build --root-owner-group -Znone "$content" "$MACHINES/packages-$to" >/dev/null
        rm -r "$content"
    done
}

version_at() { at "$1" dpkg-query -W -f '${binary:Package} ${Version} ${Status}\n' '*zel*'; }

one_package_alone_is_refused() {  # scenario
    local from before package
    from=$(at client dpkg-query -W -f '${Version}' libzel)
    newer_packages "$from" "$from+next"
    give_packages client "$MACHINES/packages-$from+next"
    before=$(version_at client)
    for package in libzel zel-client; do
        fails at client bash -c "dpkg -i /root/packages/${package}_*"
        is "$(version_at client)" "$before"
    done
    fails at client bash -c "apt-get install -y --no-remove /root/packages/libzel_*"
    fails at client bash -c "apt-get install -y --no-remove /root/packages/zel-client_*"
    is "$(version_at client)" "$before"
    active client zel_daemon
    at client zelctl status
}

upgrade_in_a_push() {  # scenario
    local from name
    from=$(at client dpkg-query -W -f '${Version}' libzel)
    newer_packages "$from" "$from+next"
    for name in server client; do
        give_packages "$name" "$MACHINES/packages-$from+next"
        in_a_push
        at "$name" bash -c "cd /root/packages && apt-get install -y --no-remove ./libzel_*.deb ./zel-${name}_*.deb"
        is "$(at "$name" dpkg-query -W -f '${Version}' "zel-$name")" "$from+next"
        until_true 60 in_step
    done
    active client zel_daemon
    active server zel_rsyncd
    at client zelctl doctor
    # And back.
    for name in server client; do
        give_packages "$name" "$packages"
        at "$name" bash -c "cd /root/packages && apt-get install -y --allow-downgrades --no-remove ./libzel_*.deb ./zel-${name}_*.deb"
        is "$(at "$name" dpkg-query -W -f '${Version}' "zel-$name")" "$from"
    done
    at client bash -c 'date >/srv/photos/date'
    until_true 30 in_step
}
