# Completes gsctl in bash: commands and options as gsctl itself lists them, groups as the daemon does.
_gsctl() {
  local word=${COMP_WORDS[COMP_CWORD]} command= i
  local -a daemon=()
  for ((i = 1; i < COMP_CWORD; i++)); do
    case ${COMP_WORDS[i]} in
      --) COMPREPLY=($(compgen -cf -- "$word")); return ;; # CMD
      --endpoint) ((++i < COMP_CWORD)) && daemon=(--endpoint "${COMP_WORDS[i]}") ;;
      --timeout) ((i++)) ;;
      -*) ;;
      *) command=${command:-${COMP_WORDS[i]}} ;;
    esac
  done
  case ${COMP_WORDS[COMP_CWORD - 1]} in
    --vote) COMPREPLY=($(compgen -W "approve reject" -- "$word")); return ;;
    --vote-with | --exec) COMPREPLY=($(compgen -cf -- "$word")); return ;;
    --endpoint | -o | --output) return ;; # files
    --timeout | --interval | --grace | --from | --to) return ;;
  esac
  if [[ $word == -* ]]; then
    COMPREPLY=($(compgen -W "$({ gsctl $command --help; gsctl --help; } 2>/dev/null | grep -o -- '--[a-z][a-z-]*')" -- "$word"))
  elif [[ -z $command ]]; then
    COMPREPLY=($(compgen -W "$(gsctl --help 2>/dev/null | sed -n '/^Subcommands:/,/^$/s/^  \([a-z]*\).*/\1/p')" -- "$word"))
  elif [[ " status nodes sessions top stats chart " != *" $command "* ]]; then
    local name # may be anything a client chose: nothing here expands it
    while IFS= read -r name; do
      [[ $name != "$word"* ]] || COMPREPLY+=("$(printf %q "$name")")
    done < <(gsctl "${daemon[@]}" --json --timeout 2 groups 2>/dev/null | sed -n 's/.*"group":"\([^"\\]*\)".*/\1/p')
  fi
}
complete -o default -F _gsctl gsctl
