# What administrators get wrong is refused or told, and what runs goes on.
# shellcheck shell=bash

# Through ssh the server's own daemon is reached, at its loopback address.
through_ssh() {  # scenario
    at server useradd alice
    echo "alice:$password" | at server chpasswd
    at client bash -c 'mkdir /srv/letters && echo dear >/srv/letters/one'
    at client zelctl share add letters /srv/letters
    typed client "zelctl task add letters --share letters --server nas2 --user alice --ssh --manual"
    at client zelctl task run letters --wait
    same_tree /srv/letters /srv/copies/letters
    at server zel_server setup --address 10.77.0.2
    at client bash -c 'echo yours >/srv/letters/two'
    at client zelctl task run letters photos --wait
    same_tree /srv/letters /srv/copies/letters
    at server zel_server setup --address all
    at server zel_server status
    at client zelctl doctor
}
