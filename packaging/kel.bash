# Completion of kel's options; its other arguments are names of localizations, which only bundles know.
_kel() {
  local options="-debug -dump -dump_cache -flush -generate_whitelist -help -mockar -update"
  mapfile -t COMPREPLY < <(compgen -W "$options" -- "${COMP_WORDS[COMP_CWORD]/#--/-}")
}
complete -F _kel kel
