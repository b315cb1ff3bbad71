# bash completion of heft and its companions: options, their arguments, names and ids of processes, files.

# Ids of processes.
_heft_pids() {
    local folder
    for folder in /proc/[0-9]*; do echo "${folder#/proc/}"; done
}

# Names and ids of processes; 0 is the kernel. A name with blanks is one line.
_heft_processes() {
    cat /proc/[0-9]*/comm 2>/dev/null
    echo kernel_task
    echo 0
    _heft_pids
}

# Adds the lines that the command "$2 ..." prints and that begin with $1 to the answers.
_heft_offer() {
    local line
    while IFS= read -r line; do
        [[ $line == "$1"* ]] && COMPREPLY+=("$line")
    done < <("${@:2}" | sort -u)
}

_heft_offer_words() {
    _heft_offer "$1" printf '%s\n' "${@:2}"
}

_heft_offer_files() {
    local line
    while IFS= read -r line; do COMPREPLY+=("$line"); done < <(compgen -f -- "$1")
}

# What may stand at a place of heft's command line: after the word $1, beginning with $2.
_heft_report() {
    case $1 in
        -f | --format) _heft_offer_words "$2" bytes formatted pages ;;
        --sort) _heft_offer_words "$2" dirty swapped clean reclaimable wired regions category ;;
        -j | --json) _heft_offer_files "$2" ;;
        --pid) _heft_offer "$2" _heft_pids ;;
        -p | --proc | -x | --exclude) _heft_offer "$2" _heft_processes ;;
        *)
            if [[ $2 == -* ]]; then
                _heft_offer_words "$2" -a --all -j --json -h --help -t --targetChildren -p --proc --pid -x --exclude -s --skip -v \
                    -f --format --sort -w --wide --swapped --wired --vmObjectDirty --unmapped
            else
                _heft_offer "$2" _heft_processes
                _heft_offer_files "$2"
            fi
            ;;
    esac
}

_heft_record() {
    local words=("${COMP_WORDS[@]:1:COMP_CWORD}") kind=${COMP_WORDS[1]} at=$COMP_CWORD
    if [ "$at" -eq 1 ]; then
        _heft_offer_words "$1" machine memgraph -h --help --version
        return
    fi
    if [ "$at" -eq 2 ] && [[ $1 == -* ]]; then
        [ "$kind" = machine ] && _heft_offer_words "$1" --anonymize
        [ "$kind" = memgraph ] && _heft_offer_words "$1" --vmObjectDirty
        return
    fi
    [[ ${words[1]} == --* ]] && at=$((at - 1))
    case $kind$at in
        machine2 | memgraph3) _heft_offer_files "$1" ;;
        machine*)
            _heft_offer_words "$1" 0
            _heft_offer "$1" _heft_pids
            ;;
        memgraph2) _heft_offer "$1" _heft_pids ;;
    esac
}

# heft-top, heft-diff, heft-html, heft-metrics: after the word $2, beginning with $3.
_heft_companion() {
    case $1:$2 in
        heft-top:-b | heft-top:--by) _heft_offer_words "$3" process command user unit container ;;
        heft-top:-s | heft-top:--sort)
            _heft_offer_words "$3" heft freed shared swapped reclaimable cgroup change growth processes name
            ;;
        *:-n | *:--lines | *:--largest | *:-w | *:--watch | *:-c | *:--count | *:-l | *:--least | *:--fail-above) ;;
        *)
            local options="-h --help --version"
            case $1 in
                heft-top) options+=" -b --by -n --lines -s --sort -w --watch -c --count --fail-above -j --json" ;;
                heft-diff) options+=" -l --least -n --lines --fail-above -j --json" ;;
                heft-html) options+=" -o --output" ;;
                heft-metrics) options+=" -o --output -n --largest" ;;
            esac
            if [[ $3 == -* ]]; then _heft_offer_words "$3" $options; else _heft_offer_files "$3"; fi
            ;;
    esac
}

_heft() {
    local word=${2//\\/} before=$3
    COMPREPLY=()
    compopt -o filenames 2>/dev/null # the shell quotes what needs it: names may have blanks
    # An argument after "=", which bash takes for a word.
    if [ "$word" = = ]; then word=; fi
    if [ "$before" = = ]; then before=${COMP_WORDS[COMP_CWORD - 2]}; fi
    if [ "$2" = = ]; then before=${COMP_WORDS[COMP_CWORD - 1]}; fi
    case ${1##*/} in
        heft-record) _heft_record "$word" ;;
        heft-replay)
            if [ "$COMP_CWORD" -eq 1 ]; then
                if [[ $word == -* ]]; then _heft_offer_words "$word" -h --help --version; else _heft_offer_files "$word"; fi
            else
                _heft_report "$before" "$word"
            fi
            ;;
        heft) _heft_report "$before" "$word" ;;
        *) _heft_companion "${1##*/}" "$before" "$word" ;;
    esac
}
complete -F _heft heft heft-record heft-replay heft-top heft-diff heft-html heft-metrics
