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

_zq3ckrst() {
  local word=${COMP_WORDS[COMP_CWORD]} previous=${COMP_WORDS[COMP_CWORD - 1]}
  COMPREPLY=()
  case $previous in
    -d) mapfile -t COMPREPLY < <(_zq3ckrst_aliases "$word") ;;
    -r) local types="DATABASE TABLESPACE"
      [[ $word == *[a-z]* ]] && types=${types,,}
      mapfile -t COMPREPLY < <(compgen -W "$types" -- "$word") ;;
    -t | -n) ;;
    *) mapfile -t COMPREPLY < <(compgen -W "-d -t -r -n -v -h" -- "$word") ;;
  esac
}

complete -F _zq3ckrst zq3ckrst
