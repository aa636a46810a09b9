# What the completions of zelctl, zel_server and zel_daemon share.

# Sets words, cur and prev: what stands before the cursor's word, that word, and the one before it. For readline ":" and
# "=" end a word, for the programs they do not: lead is what readline keeps of cur. "--option=value" counts as two words.
_zel_parse() {
    local i word joined=no
    words=() lead=
    for ((i = 1; i <= COMP_CWORD; i++)); do
        word=${COMP_WORDS[i]}
        if [[ $word == [:=]* && ${#words[@]} -gt 0 ]]; then
            lead=${words[-1]}$word
            words[-1]=$lead joined=yes
        elif [[ $joined == yes ]]; then
            words[-1]+=$word joined=no
        else
            words+=("$word")
            lead=
        fi
    done
    cur=${words[-1]}
    unset 'words[-1]'
    if [[ $cur == --*=* ]]; then
        words+=("${cur%%=*}")
        lead=${lead#*=} cur=${cur#*=}
    fi
    prev=
    if ((${#words[@]})); then prev=${words[-1]}; fi
}

# Completes to the lines of standard input, whatever is in them.
_zel_offer() {
    local line quote= typed=$cur
    case $typed in
        [\"\']*) quote=${typed:0:1} typed=${typed:1} ;;
        *) typed=${typed//\\/} ;;
    esac
    while IFS= read -r line; do
        [[ $line == "$typed"* ]] || continue
        line=${line#"$lead"}
        case $quote in
            "") printf -v line %q "$line" ;;
            \") line=${line//\\/\\\\} line=${line//\$/\\\$} line=${line//\`/\\\`} ;;
        esac
        COMPREPLY+=("$line")
    done
}

_zel_words() { _zel_offer < <(printf '%s\n' "$@"); }

# Completes to the strings that a list in JSON has under this key: KEY COMMAND...
_zel_from_list() {
    local key=$1
    shift
    _zel_offer < <(timeout 2 "$@" --json 2>/dev/null </dev/null |
        grep -oE "\"$key\": *\"([^\"\\\\]|\\\\.)*\"" | sed -E 's/^[^:]*: *"(.*)"$/\1/; s/\\(.)/\1/g')
}

# Leaves it to readline to complete files, or folders with "dirnames".
_zel_files() { compopt -o "${1:-default}"; }

# What a command's help says that it takes, COMMAND...: sets options, valued (those of them that want a value, each between
# blanks) and commands.
_zel_learn() {
    local line word names section=
    options=() valued=" " commands=()
    while IFS= read -r line; do
        case $line in
            [A-Z]*:) section=$line ;;
            "  -"*)
                names=
                line=${line#  }
                for word in ${line%%  *}; do
                    word=${word%,}
                    case $word in
                        --*) options+=("$word") names+="$word " ;;
                        -*) names+="$word " ;;
                        *) valued+=$names ;;
                    esac
                done
                ;;
            "  "[a-z]*)
                line=${line#  }
                [[ $section != Commands: ]] || commands+=("${line%% *}")
                ;;
        esac
    done < <(timeout 2 "$@" --help 2>/dev/null </dev/null)
}
