#!/usr/bin/env bash
# Do the documents say what the programs do? match.sh ZQ3CKRST ZQ3HIST
set -u
zq3ckrst=$1 zq3hist=$2
cd "$(dirname "$0")/../.." || exit 1
failures=0

# same WHAT EXPECTED FOUND: two lists of lines are equal, whatever their order.
same() {
  local expected found
  expected=$(sort -u <<<"$2") found=$(sort -u <<<"$3")
  [ -n "$expected" ] && [ "$expected" = "$found" ] && return
  echo "$1 (< expected, > found):"
  diff <(echo "$expected") <(echo "$found")
  failures=$((failures + 1))
}

# holds FILE TEXT...: each text is in the file's text, line breaks and formatting aside.
holds() {
  local file=$1 plain text
  shift
  case $file in
    man/*) plain=$(mandoc -Tascii -Owidth=1000 "$file" | sed "s,.\x08,,g" | tr -s ' \t\n' ' ') ;;
    *) plain=$(tr -s ' \t\n' ' ' <"$file") ;;
  esac
  for text; do
    [[ $plain == *"$text"* ]] || { echo "$file lacks: $text"; failures=$((failures + 1)); }
  done
}

# Which other pages the machine has is not the pages' fault.
lint=$(mandoc -Tlint man/* 2>/dev/null | grep -v 'referenced manual not found')
[ -z "$lint" ] || { echo "$lint"; failures=$((failures + 1)); }

# zq3ckrst: -v is the one option that the help text does not show.
help=$("$zq3ckrst" -h 2>&1)
options=$(grep -oP '^   -\K[a-z?]+(?= )' <<<"${help%%Usage*}" | grep -o .; echo v)
same "options of zq3ckrst(1)" "$options" \
  "$(grep -oP '^\.It Fl \K.*' man/zq3ckrst.1 | grep -oP '(^|, |\\&)\K[a-z?]')"
same "options completed for zq3ckrst" "$(grep -v '[u?]' <<<"$options")" \
  "$(grep -oP 'compgen -W "\K-d[^"]*' completion/zq3ckrst.bash | grep -o '[a-z]')"
messages=$(tr -d '\n' <tool/zq3ckrst.h | grep -oP 'planMessage \K.*?;')
declare -A codes
while read -r name code; do codes[$name]=$code; done \
  < <(grep -oP '^    \w+ = -\d+(?=,)' tool/zq3ckrst.h | tr -d =)
same "messages of zq3ckrst(1)" \
  "$(grep -oP '= \{\K"[^}]*' <<<"$messages" | sed -E 's/\\n/ /g; s/^"([^".%]*[^".% ]).*" *, *(\w+), *([0-9]+)$/\2 \3 \1/' |
    while read -r code rest; do echo "${codes[$code]} $rest"; done)" \
  "$(sed -nE 's/^\.It Li (\\&)?([^\\]*[^\\ ]).* Pq \\(-[0-9]+)[,;] (.*)/\3 \2, \4/p' man/zq3ckrst.1 |
    sed 's/ Ar [^,]*,/,/; s/ and /, /' |
    while IFS=', ' read -r code rest; do
      grep -oP '\d+' <<<"$rest" | sed "s/.*/$code & ${rest%%,*}/"
    done)"
mapfile -t texts < <(grep -oP '= \{"\K[^"%\\]*' <<<"$messages" | sed 's/ *$//')
holds man/zq3ckrst.1 "${texts[@]}"
holds docs/troubleshooting.md "${texts[@]}"
same "exit statuses in zq3ckrst(1)" \
  "$(grep -oP '^    \w+ = -\K\d+(?=,)' tool/zq3ckrst.h | while read -r code; do
    echo "$((256 - code)) -$code"; done)" \
  "$(grep -oP '^\.It \K\d+ Ta \\-\d+' man/zq3ckrst.1 | sed 's/ Ta \\/ /')"

# zq3hist: the commands with their arguments as the help text gives them, and the fields of stanzas.
help=$("$zq3hist" --help)
same "commands of zq3hist(1)" \
  "$(grep -oP '^  \K[a-z][a-z-]* +[A-Z. \[\]]+(?= )' <<<"$help" | tr -s ' ' | sed 's/ $//' |
    tr '[:lower:]' '[:upper:]')" \
  "$(mandoc -Tascii -Owidth=1000 man/zq3hist.1 | sed "s,.\x08,,g" | sed '/^DESCRIPTION/q' |
    grep -oP '^ {5}zq3hist \K[a-z-]+ \[option \.\.\.\].*' | sed 's/ \[option \.\.\.\]//; s/ \.\.\./.../' |
    tr '[:lower:]' '[:upper:]')"
commands=$(grep -oP '^  \K[a-z][a-z-]*(?= +[A-Z])' <<<"$help")
mapfile -t words < <(echo "$commands"; echo "$help" | grep -oP '^  \K--[a-z-]+'
  for command in $commands; do "$zq3hist" help "$command" | grep -oP '^  \K--[a-z-]+'; done | sort -u)
holds man/zq3hist.1 "${words[@]}"
mapfile -t words <<<"$commands"
holds completion/zq3hist.bash "${words[@]}" # options it takes from the help
mapfile -t texts < <(grep -ohP '^ *(\{|[A-Z]+\()"\K[A-Z][^"]*' admin/fields.cpp)
holds man/zq3hist.1 "${texts[@]}"

# The variables that the programs and what they load read. ZQ3SYNC says nothing to who only looks.
variables() { grep -rohP 'getenv\("\K\w+' "$@"; }
documented() { sed -n '/^\.Sh ENVIRONMENT/,/^\.El/s/^\.It Ev //p' "$1"; }
same "variables in zq3ckrst(1)" "$(variables tool platform | grep -v ZQ3SYNC)" \
  "$(documented man/zq3ckrst.1)"
same "variables in zq3hist(1)" "$(variables admin platform/osse)" "$(documented man/zq3hist.1)"

# The header's fields as the library has them: width by width from the format text, with the members
# in the order they are printed; a member's image offset follows from the members before it.
headerFields() {
  local -A image=([at]=0)
  local at=0 bits member count width
  while read -r bits member count; do
    image[$member]=${image[at]}
    image[at]=$((image[at] + ${bits:-8} * ${count:-1} / 8))
  done < <(sed -n '/^struct SQLUH_HEADER {/,/^}/p' history/sqluhist.h |
    sed -nE 's/^    char /    uint8_t /; s/^    uint([0-9]+)_t (\w+)(\[([0-9]+)\])?;.*/\1 \2 \4/p')
  while read -r width member; do
    echo "$at $width ${image[$member]} $member"
    at=$((at + width + 1))
  done < <(paste -d ' ' \
    <(sed -n '/ headerFormat\[\] =/,/;$/p' history/sqluhist.h | grep -oP '%-?\K(\d+|c)' | tr c 1) \
    <(tr -d '\n' <history/sqluhHeader.cpp | grep -oP 'buffer, headerFormat, \K[^"]*' |
      grep -oP 'header->\K\w+') | grep ' .')
}

# zq3rhist(5) and the log records.
same "fields of a header in zq3rhist(5)" "$(headerFields)" \
  "$(sed -n '/^\.Ss Header/,/^\.El/p' man/zq3rhist.5 | grep -oP '^\.It \K\d+ Ta \d+ Ta \d+ Ta \w+' |
    sed 's/ Ta / /g')"
same "fields of an entry in zq3rhist(5)" \
  "$(tr -d '\n' <history/sqluhist.h | grep -oP 'entryFields\[\w+\] = \{\K.*?(?=\};)' |
    grep -oP '\{\K\d+, \d+' | tr -d ,)" \
  "$(sed -n '/^\.Ss Entry/,/^\.El/p' man/zq3rhist.5 | grep -oP '^\.It \K\d+ Ta \d+ Ta \w+' |
    sed 's/ Ta / /;s/ Ta .*//')"
same "the example of libsqluhist(3)" "$(nl examples/append.cpp)" \
  "$(sed -n '/^\.Bd -literal/,/^\.Ed/p' man/libsqluhist.3 | sed '1d;$d; s/\\e/\\/g' | nl)"
mapfile -t texts < <(tr '\n' ' ' <history/sqluhDiagnostics.h |
  grep -oP '#define TEXT_\w+[ \\]+"\K[^"%\\]*' | sed 's/ *$//; s/  / /g')
holds docs/troubleshooting.md "${texts[@]}"

exit $((failures > 0))
