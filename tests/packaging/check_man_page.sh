#!/usr/bin/env bash
# Checks that the manual page's OPTIONS section lists exactly the options of
# the tool's --help, with the same short and long names paired.
# usage: check_man_page.sh MAN_PAGE COMMAND...   (COMMAND --help is run)
set -euo pipefail
man_page=$1
shift

# The option names at the start of each line, one entry per line:
# "-b, --base=arg   Base path..." and ".BR \-b ", " \-\-base =\fIPATH\fR"
# both become "-b --base".
option_names() {
  local line
  while IFS= read -r line; do
    grep -oE '(^| )--?[A-Za-z0-9][A-Za-z0-9-]*' <<<"$line" | tr -d ' ' | paste -sd ' ' - | grep . || true
  done
}

help_text=$("$@" --help) || { echo "--help exited with status $?"; exit 1; }
help_options=$(printf '%s\n' "$help_text" | sed -n 's/^  \(-[^ ,]*\(, -[^ ,]*\)*\).*/\1/p' |
  sed 's/=[^ ,]*//g; s/,/ /g' | option_names | sort)

# The tag line after each .TP of the OPTIONS section.
man_options=$(awk '/^\.SH /{in_options = ($2 == "OPTIONS")}
                   in_options && tag {print; tag = 0}
                   in_options && /^\.TP/{tag = 1}' "$man_page" |
  sed 's/^\.[A-Z]* //; s/\\-/-/g; s/\\f[A-Z]//g; s/"//g; s/=[^ ]*//g' | option_names | sort)

[ -n "$help_options" ] || { echo "no options in --help"; exit 1; }
[ -n "$man_options" ] || { echo "no options in the manual page's OPTIONS section"; exit 1; }
status=0
while IFS= read -r entry; do
  echo "only in --help: $entry"
  status=1
done < <(comm -23 <(echo "$help_options") <(echo "$man_options"))
while IFS= read -r entry; do
  echo "only in the manual page: $entry"
  status=1
done < <(comm -13 <(echo "$help_options") <(echo "$man_options"))
exit $status
