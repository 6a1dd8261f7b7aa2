# bash completion for ostrelctl(1)

_ostrelctl() {
  local word=${COMP_WORDS[COMP_CWORD]} command=${COMP_WORDS[1]} sub=${COMP_WORDS[2]}
  local words=
  COMPREPLY=()

  if [ "$COMP_CWORD" -eq 1 ]; then
    words='script status send sessions show tail query defaults notify channels --help --version'
  else
    case $command in
      script)
        [[ $word == -* ]] || {
          mapfile -t COMPREPLY < <(compgen -f -- "$word")
          return
        }
        words='--help'
        ;;
      status) words='--json --help' ;;
      send) words='--category --type --reporter --payload --timeout --json --help' ;;
      sessions) words='--limit --json --help' ;;
      show) words='last --json --help' ;;
      tail) words='--lines --count --json --help' ;;
      query) words='--json --help' ;;
      notify) words='--help' ;;
      defaults)
        if [ "$COMP_CWORD" -eq 2 ]; then
          words='read write delete --help'
        elif [ "$COMP_CWORD" -eq 3 ]; then
          words='disable_reporting device_name --help'
        fi
        [ "$sub" != read ] || words+=' --json'
        ;;
      channels)
        if [ "$COMP_CWORD" -eq 2 ]; then
          words='list publish --help'
        else
          words='--group --subgroup --help'
          [ "$sub" != list ] || words+=' --json'
        fi
        ;;
    esac
  fi
  mapfile -t COMPREPLY < <(compgen -W "$words" -- "$word")
}

complete -F _ostrelctl ostrelctl
