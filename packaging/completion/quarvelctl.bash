# bash completion of quarvelctl

# The reporter IDs of the sessions that the store had last. Not asked of the service, which that would
# start.
_quarvelctl_reporters() {
  quarvelctl sessions --last 100 --json 2>/dev/null | sed 's/^{"id":[0-9]*,"session":\(-\{0,1\}[0-9]*\),.*/\1/' | sort -u
}

_quarvelctl() {
  local current=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD-1]} word command= part=
  local skip=false
  for word in "${COMP_WORDS[@]:1:COMP_CWORD-1}"; do
    if $skip; then
      skip=false
      continue
    fi
    case $word in
      --socket | --store | --session | --since | --last | --before | --domain) skip=true ;;
      -*) ;;
      *)
        if [[ -z $command ]]; then
          command=$word
        elif [[ -z $part ]]; then
          part=$word
        fi
        ;;
    esac
  done

  local everywhere='--help --json --socket --store' words=
  case $previous in
    --socket | --store)
      compopt -o filenames
      mapfile -t COMPREPLY < <(compgen -f -- "$current")
      return
      ;;
    --session)
      mapfile -t COMPREPLY < <(compgen -W "$(_quarvelctl_reporters) -1" -- "$current")
      return
      ;;
    --since)
      mapfile -t COMPREPLY < <(compgen -W '10m 1h 1d 1w' -- "$current")
      return
      ;;
    --domain)
      mapfile -t COMPREPLY < <(compgen -W 'tarnwick.quarvel' -- "$current")
      return
      ;;
    --last | --before) return ;;
  esac
  case $command in
    '') words="$everywhere --version run reporters valid status kill sessions messages events power summary exports erase defaults notify" ;;
    run)
      if [[ $current != -* ]]; then
        compopt -o filenames
        mapfile -t COMPREPLY < <(compgen -f -X '!*.jsonl' -- "$current"; compgen -d -- "$current")
        return
      fi
      words=$everywhere
      ;;
    valid | summary)
      words=$everywhere
      if [[ -z $part && $current != --* ]]; then words=$(_quarvelctl_reporters); fi
      ;;
    sessions) words="$everywhere --since --last" ;;
    messages) words="$everywhere --session --since --last --follow" ;;
    exports) words="$everywhere --last --wait" ;;
    erase) words="$everywhere --session --before --all" ;;
    events | power) words="$everywhere --since --last --follow" ;;
    defaults)
      case $part in
        '') words="$everywhere --domain read write delete" ;;
        read) words="$everywhere --domain" ;;
        write) words="$everywhere --domain --string --notify" ;;
        delete) words="$everywhere --domain --notify" ;;
      esac
      if [[ -n $part && $current != -* ]]; then
        words='disable_reporting device_name reporting_server_verbose reporting_session_verbose reporting_driver_verbose'
      fi
      ;;
    notify)
      words=$everywhere
      if [[ $current != -* ]]; then words='tarnwick.quarvel.reporting tarnwick.quarvel.status'; fi
      ;;
    *) words=$everywhere ;;
  esac
  mapfile -t COMPREPLY < <(compgen -W "$words" -- "$current")
}

complete -F _quarvelctl quarvelctl
