# SPDX-License-Identifier: MIT
# usage: zsh -f scripts/zsh-complete.zsh FOLDER LINE...
# Types each LINE and a Tab into an interactive zsh whose completion functions come first from
# FOLDER, and prints for each LINE "LINE|CANDIDATES": the candidates the completion offered,
# sorted, unique and space-separated. compadd is wrapped to report every match it is given; the matches still
# go in, so that completion functions which look at what they added behave as they would.
zmodload zsh/zpty || exit 2
folder=$1
shift
zpty shell zsh -f -i
zpty -w shell "PROMPT='' RPROMPT='' PROMPT_EOL_MARK=''
unsetopt zle_bracketed_paste auto_list list_ambiguous list_beep beep
fpath=(${(q)folder} \$fpath)
autoload -Uz compinit && compinit -u -D
compadd() {
  if [[ \${@[1,(i)(-|--)]} == *-(O|A|D)\\ * ]]; then builtin compadd \"\$@\"; return; fi
  local -a hits
  builtin compadd -A hits \"\$@\"
  local hit
  for hit in \$hits; do print -rn -- \"<cand>\${hit}</cand>\"; done
  builtin compadd \"\$@\"
}
offered() { print -rn -- '<begin>'; zle complete-word; print -rn -- '<end>'; zle kill-whole-line }
zle -N offered
bindkey '^I' offered
print -r -- '<ready>'"
zpty -r shell out '*<ready>*' || exit 3
for line in "$@"; do
  zpty -w -n shell "${line}"$'\t'
  zpty -r shell out '*<end>*' || exit 4
  out=${out##*<begin>}
  offered=(${(ou)${(M)${(s:</cand>:)out}:#*<cand>*}##*<cand>})
  print -r -- "${line}|${(j: :)offered}"
done
zpty -d shell
