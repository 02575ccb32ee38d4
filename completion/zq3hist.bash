# bash completion for zq3hist

_zq3hist() {
  local word=${COMP_WORDS[COMP_CWORD]} command=${COMP_WORDS[1]} i position=0
  local commands="load dump status verify repair copy backup restore unlock images plan"
  COMPREPLY=()
  if ((COMP_CWORD == 1)); then
    mapfile -t COMPREPLY < <(compgen -W "$commands --help --version" -- "$word")
    return
  fi
  if [[ $word == -* ]]; then
    case $command in
      dump | status | images | plan) mapfile -t COMPREPLY < <(compgen -W "--json" -- "$word") ;;
    esac
    return
  fi
  # The word's place among the arguments that are no options.
  for ((i = 2; i <= COMP_CWORD; i++)); do
    [[ ${COMP_WORDS[i]} == -* ]] || position=$((position + 1))
  done
  compopt -o filenames 2>/dev/null
  case $command:$position in
    *:1 | copy:2) mapfile -t COMPREPLY < <(compgen -d -- "$word") ;;
    load:2 | backup:2 | restore:2) mapfile -t COMPREPLY < <(compgen -f -- "$word") ;;
  esac
}

complete -F _zq3hist zq3hist
