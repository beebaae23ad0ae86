# bash completion for vessactl: verbs, their sub-verbs, container classes.
# Install as /usr/share/bash-completion/completions/vessactl (cmake --install does).
_vessactl() {
  local cur prev verbs classes
  cur=${COMP_WORDS[COMP_CWORD]}
  prev=${COMP_WORDS[COMP_CWORD-1]}
  verbs="create lookup ls show rm wipe replace regen-uuid restructure info groups cs protect
         usage assets deathrow personas test-lock status notifications provision"
  classes="bundle data plugin plugin-data vpn-plugin vpn-plugin-data group framework
           relay-service daemon-data temp system system-group"
  case "$prev" in
    --class) COMPREPLY=($(compgen -W "$classes" -- "$cur")); return ;;
    --root | --file) COMPREPLY=($(compgen -f -- "$cur")); return ;;
    info) COMPREPLY=($(compgen -W "get set unset" -- "$cur")); return ;;
    cs) COMPREPLY=($(compgen -W "get set" -- "$cur")); return ;;
    deathrow) COMPREPLY=($(compgen -W "empty" -- "$cur")); return ;;
  esac
  if [[ "$cur" == -* ]]; then
    COMPREPLY=($(compgen -W "--root --socket --file --json --timeout --help --class --persona
                              --uuid --transient --retry --create --mobile-user
                              --mobile-uid --force" -- "$cur"))
  else
    COMPREPLY=($(compgen -W "$verbs" -- "$cur"))
  fi
}
complete -F _vessactl vessactl
