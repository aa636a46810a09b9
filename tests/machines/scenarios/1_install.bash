# The packages, and the five commands of the README.
# shellcheck shell=bash

packages_are_installed_with_apt() {  # scenario
    local name line
    for name in client server; do
        system_files "$name" >"$MACHINES/before-$name"
        give_packages "$name" "$packages"
        line=$(sed -n "s/^    \(apt install .*\)  # at the $name/\1/p" "$project/docs/operations.md")
        at "$name" bash -c "cd /root/packages && $line -y"
    done
    active client zel_daemon
    at server systemctl is-enabled zel_rsyncd
    fails active server zel_rsyncd  # until it is set up
}

five_commands_are_five() {  # scenario
    at client mkdir -p "/srv/photos/2024 summer"
    random_file "/srv/photos/2024 summer/one" 1
    local side line
    for side in server client; do
        while read -r line; do
            # The last one shows what goes on for as long as one likes.
            if [ "$line" = "zelctl task watch" ]; then line="timeout --signal=INT 2 $line || [ \$? -eq 124 ]"; fi
            typed "$side" "$line"
        done < <(commands_of README.md "Two machines in five commands" "At the $side, as root:")
        # In place of the one that was made for her.
        if [ "$side" = server ]; then echo "$password" | at server zel_server account add alice --password-file -; fi
    done
    until_true 30 in_step
    at server zel_server status
    at client zelctl doctor
}

# What the documentation says of each unit's confinement is what systemd computes.
units_are_confined_as_documented() {  # scenario
    local name unit
    for name in client:zel_daemon server:zel_rsyncd server:zel_front; do
        unit=${name#*:}
        is "$(at "${name%:*}" systemd-analyze security --no-pager "$unit" | sed -n 's/.*exposure level for .*: \([0-9.]*\) .*/\1/p')" \
            "$(sed -n "s/^| \`$unit\` | \([0-9.]*\) |.*/\1/p" "$project/docs/operations.md")"
    done
}
