# Completes gsctl in bash: commands and options as gsctl itself lists them, groups as the daemon does.
_gsctl() {
  local word=${COMP_WORDS[COMP_CWORD]} command= i
  for ((i = 1; i < COMP_CWORD; i++)); do
    case ${COMP_WORDS[i]} in
      --) COMPREPLY=($(compgen -cf -- "$word")); return ;; # CMD
      --endpoint | --timeout) ((i++)) ;;
      -*) ;;
      *) command=${command:-${COMP_WORDS[i]}} ;;
    esac
  done
  if [[ $word == -* ]]; then
    COMPREPLY=($(compgen -W "$(gsctl $command --help 2>/dev/null | grep -o -- '--[a-z][a-z-]*')" -- "$word"))
  elif [[ -z $command ]]; then
    COMPREPLY=($(compgen -W "$(gsctl --help 2>/dev/null | sed -n '/^Subcommands:/,/^$/s/^  \([a-z]*\).*/\1/p')" -- "$word"))
  elif [[ $command != chart ]]; then
    local name # may be anything a client chose: nothing here expands it
    while IFS= read -r name; do
      [[ $name != "$word"* ]] || COMPREPLY+=("$(printf %q "$name")")
    done < <(gsctl --json --timeout 2 groups 2>/dev/null | sed -n 's/.*"group":"\([^"\\]*\)".*/\1/p')
  fi
}
complete -o default -F _gsctl gsctl
