# bash completion for ekctl
_ekctl() {
  local cur prev words cword
  _init_completion || return
  local commands="raw add remove bulk match list info find ready access annotate bulk-annotate
    hold release watch defaults"
  local global="-S --json -o --output --timeout --user --system --version --help"
  case $prev in
    -o | --output)
      COMPREPLY=($(compgen -W "table json wire" -- "$cur"))
      return
      ;;
    -S | --timeout | --flags | --env | --set | --uuid | --point)
      return
      ;;
    --url | --app)
      _filedir -d
      return
      ;;
  esac
  local command="" i
  for ((i = 1; i < cword; i++)); do
    case ${words[i]} in
      -S | -o | --output | --timeout) ((i++)) ;;
      -*) ;;
      *)
        command=${words[i]}
        break
        ;;
    esac
  done
  if [[ -z $command ]]; then
    COMPREPLY=($(compgen -W "$commands $global" -- "$cur"))
    return
  fi
  local options=""
  case $command in
    add | remove | hold)
      options="--flags"
      [[ $cur != -* ]] && { _filedir -d; return; }
      ;;
    match | bulk | access) options="--flags" ;;
    list) options="--point --app --elected --flags" ;;
    info)
      [[ $cur != -* ]] && { _filedir -d; return; }
      ;;
    find) options="--uuid --url" ;;
    ready) options="--flags --env" ;;
    annotate) options="--set" ;;
    defaults)
      [[ $cword -eq $((i + 1)) ]] && { COMPREPLY=($(compgen -W "read write delete" -- "$cur")); return; }
      ;;
  esac
  COMPREPLY=($(compgen -W "$options $global" -- "$cur"))
}
complete -F _ekctl ekctl
