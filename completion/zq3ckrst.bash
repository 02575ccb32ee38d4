# bash completion for zq3ckrst

# The databases under $ZQ3DBPATH whose alias begins with $1, in the letter case that $1 has.
_zq3ckrst_aliases() {
  local path alias
  for path in "${ZQ3DBPATH:-.}"/*/zq3rhist.asc; do
    [ -e "$path" ] || continue
    path=${path%/*}
    alias=${path##*/}
    [[ $alias =~ ^[A-Z0-9_#@$]{1,8}$ && $alias == "${1^^}"* ]] || continue
    [[ $1 == *[a-z]* ]] && alias=${alias,,}
    printf '%q\n' "$alias"
  done
}

# What zq3hist, which comes with zq3ckrst, prints of the database on the command line.
_zq3ckrst_ask() {
  local i alias=
  for ((i = 1; i < COMP_CWORD; i++)); do
    [[ ${COMP_WORDS[i]} == -d ]] && alias=${COMP_WORDS[i + 1]}
  done
  [ -n "$alias" ] && zq3hist "$1" --json -d "$alias" 2>/dev/null
}

_zq3ckrst() {
  local word=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD - 1]}
  COMPREPLY=()
  case $previous in
    -d) mapfile -t COMPREPLY < <(_zq3ckrst_aliases "$word") ;;
    -r) local types="DATABASE TABLESPACE"
      [[ $word == *[a-z]* ]] && types=${types,,}
      mapfile -t COMPREPLY < <(compgen -W "$types" -- "$word") ;;
    -t) mapfile -t COMPREPLY < <(compgen -W "$(_zq3ckrst_ask images |
      grep -oP '"timestamp":"\K[0-9]{14}')" -- "$word") ;;
    -n) mapfile -t COMPREPLY < <(compgen -W "$(_zq3ckrst_ask chart |
      grep -oP '"tablespaces":\[\K[^]]*' | tr ',' '\n' | tr -d '"' | sort -u)" -- "${word^^}") ;;
    *) mapfile -t COMPREPLY < <(compgen -W "-d -t -r -n -v -h" -- "$word") ;;
  esac
}

complete -F _zq3ckrst zq3ckrst
