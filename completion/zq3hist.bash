# bash completion for zq3hist

_zq3hist() {
  local word=${COMP_WORDS[COMP_CWORD]} last=${COMP_WORDS[COMP_CWORD - 1]} command=${COMP_WORDS[1]}
  local commands="images plan chart check unneeded needed-by load dump status verify repair copy backup
    restore prune unlock help"
  local i place=() given=()
  COMPREPLY=()
  if ((COMP_CWORD == 1)) || [[ $command == help ]]; then
    mapfile -t COMPREPLY < <(compgen -W "$commands --help --version" -- "$word")
    return
  fi
  # The arguments before the word that are no options; the directory may be an alias.
  for ((i = 2; i < COMP_CWORD; i++)); do
    case ${COMP_WORDS[i]} in
      -d) place=(-d "${COMP_WORDS[++i]}") given=("" "${given[@]}") ;;
      --last | --since | --keep | --before | --have | --max-age | --svg | --wait) ((i++)) ;;
      -*) ;;
      *) given+=("${COMP_WORDS[i]}") ;;
    esac
  done
  ((${#place[@]})) || place=("$(_zq3hist_expand "${given[0]}")")
  case $last in
    -d) mapfile -t COMPREPLY < <(cd "${ZQ3DBPATH:-.}" 2>/dev/null && compgen -d -- "${word^^}") ;;
    --have | --svg) mapfile -t COMPREPLY < <(compgen -f -- "$word") ;;
    --since | --before) _zq3hist_timestamps ;;
    --last | --keep | --max-age | --wait) ;;
    *) _zq3hist_argument ;;
  esac
}

# A directory as it was typed: with a tilde or a variable in front, quoted or not.
_zq3hist_expand() {
  local typed=${1//[\"\'\\]/}
  [[ $typed =~ ^\~(/.*)?$ ]] && typed=$HOME${typed:1}
  if [[ $typed =~ ^\$\{?([A-Za-z_][A-Za-z0-9_]*)\}?(.*)$ ]]; then
    typed=${!BASH_REMATCH[1]}${BASH_REMATCH[2]}
  fi
  printf '%s\n' "$typed"
}

_zq3hist_timestamps() {
  mapfile -t COMPREPLY < <(compgen -W "$(zq3hist images "${place[@]}" 2>/dev/null |
    grep -oE '^[0-9]{14}')" -- "$word")
}

_zq3hist_argument() {
  if [[ $word == -* ]]; then
    # Each subcommand's own help tells its options.
    mapfile -t COMPREPLY < <(compgen -W "$(zq3hist help "$command" 2>/dev/null |
      grep -oE '^  --?[a-z-]+') --help" -- "$word")
    return
  fi
  case $command:${#given[@]} in
    *:0 | copy:1)
      compopt -o filenames 2>/dev/null
      mapfile -t COMPREPLY < <(compgen -d -- "$word")
      ;;
    load:1 | backup:1 | restore:1)
      compopt -o filenames 2>/dev/null
      mapfile -t COMPREPLY < <(compgen -f -- "$word")
      ;;
    plan:1 | chart:1 | needed-by:1)
      _zq3hist_timestamps
      [[ $command != needed-by ]] && mapfile -t -O ${#COMPREPLY[@]} COMPREPLY < <(compgen -W latest -- "$word")
      ;;
    plan:*)
      mapfile -t COMPREPLY < <(compgen -W "$(zq3hist chart --json "${place[@]}" 2>/dev/null |
        grep -oE '"tablespaces":\[[^]]*\]' | grep -oE '"[^"]*"' | sed '/tablespaces/d; s/"//g')" -- "${word^^}")
      ;;
  esac
}

complete -F _zq3hist zq3hist
