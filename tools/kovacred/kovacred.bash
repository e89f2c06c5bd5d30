# bash completion for kovacred(1): commands, options, credential ids and file names.

# Options that take a value, so that their value is not counted as an argument.
_kovacred_value_opts='--db --host --port --protocol --account --application --extra --owner
    --otp --params --file -q --query -d --data -H --header -b --cookie -F --upload
    --body-file -T --upload-file -o --output --format -r --retries --connect-timeout
    --response-timeout --cacert --max-time'

# The options of every command that makes requests.
_kovacred_transfer_opts='--verify --cacert --pin --max-time'

# The ids `kovacred list` prints for the database the command line (or kovacredential_db)
# names. A database that does not exist yet is not created for this.
_kovacred_ids() {
    local db=${kovacredential_db:-/usr/kova/etc/private/credentials.sqlite} i
    for ((i = 1; i < cword; i++)); do
        case ${words[i]} in
            --db) db=${words[i + 1]} ;;
            --db=*) db=${words[i]#--db=} ;;
        esac
    done
    [[ -f $db ]] || return
    "${words[0]}" --db "$db" list 2>/dev/null | awk 'NR > 1 && $1 ~ /^[0-9]+$/ { print $1 }'
}

_kovacred() {
    local cur prev words cword
    _init_completion -n = || return

    # The command, the session subcommand, and how many arguments follow them.
    local i word command="" sub="" args=0
    for ((i = 1; i < cword; i++)); do
        word=${words[i]}
        if [[ " $_kovacred_value_opts " == *[[:space:]]$word[[:space:]]* ]]; then
            ((i++))
        elif [[ $word == -* ]]; then
            :
        elif [[ -z $command ]]; then
            command=$word
        elif [[ $command == session && -z $sub ]]; then
            sub=$word
        else
            ((args++))
        fi
    done

    case $prev in
        --db | --body-file | -T | --upload-file | -o | --output | --cacert)
            _filedir
            return
            ;;
        --protocol)
            COMPREPLY=($(compgen -W 'http https' -- "$cur"))
            return
            ;;
        -F | --upload | --file)
            # FIELD=PATH: the path after the field name. Where "=" breaks words, bash
            # replaces only the path; otherwise the field goes back in front of it.
            if [[ $cur == *=* ]]; then
                local field=${cur%%=*}
                cur=${cur#*=}
                _filedir
                [[ $COMP_WORDBREAKS == *=* ]] || COMPREPLY=("${COMPREPLY[@]/#/$field=}")
            fi
            return
            ;;
        --host | --port | --account | --application | --extra | --owner | \
            --otp | --params | -q | --query | -d | --data | -H | --header | -b | --cookie | \
            --format | -r | --retries | --connect-timeout | --response-timeout | --max-time)
            return
            ;;
    esac

    local opts=""
    case $command/$sub in
        /) opts='--db --verbose --version --help' ;;
        add/) opts='--host --port --protocol --account --application --extra --owner --json' ;;
        list/ | show/ | session/show) opts='--json' ;;
        probe/ | batch/) opts="--json $_kovacred_transfer_opts" ;;
        logout/) opts="$_kovacred_transfer_opts" ;;
        session/set) opts='--extra' ;;
        login/) opts="--otp $_kovacred_transfer_opts" ;;
        apis/) opts="--json $_kovacred_transfer_opts" ;;
        call/) opts="--params --file --json --timing $_kovacred_transfer_opts" ;;
        resolve/) opts='--portal --json --max-time' ;;
        request/)
            opts='--query --data --header --cookie --upload --body-file --upload-file --output
                --format --retries --connect-timeout --response-timeout --headers --no-follow
                --fail --timing --json '"$_kovacred_transfer_opts"
            ;;
    esac
    if [[ $cur == -* ]]; then
        COMPREPLY=($(compgen -W "$opts --help" -- "$cur"))
        return
    fi

    case $command/$sub in
        /)
            COMPREPLY=($(compgen -W 'add passwd list show remove session request probe login
                logout call apis batch resolve' -- "$cur"))
            ;;
        session/)
            COMPREPLY=($(compgen -W 'show set remove' -- "$cur"))
            ;;
        show/ | passwd/ | remove/ | login/ | logout/ | call/ | apis/ | session/?*)
            ((args == 0)) && COMPREPLY=($(compgen -W "$(_kovacred_ids)" -- "$cur"))
            ;;
        batch/)
            ((args == 0)) && _filedir
            ;;
    esac
} &&
    complete -F _kovacred kovacred
