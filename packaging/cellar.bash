# Completion of the cellar program's commands and options in bash.

_cellar_options() {  # of a command
  case $1 in
    demo) echo --root --help ;;
    check) echo --version-tag --locale --session --root --json --help ;;
    tune)
      echo --store --limit --strategy --config --worth --unknown-size --sample --merge --svg --html --json --csv --key --size --time --op \
        --store-op --remove-op --clear-op --chunk-second --item-type --priority-weight --early-seconds --help
      ;;
    inspect) echo --config --top --json --html --since --watch --every --help ;;
    verify) echo --repair --config --json --help ;;
    *) echo --help --version ;;
  esac
}

_cellar() {
  local word=${COMP_WORDS[COMP_CWORD]} before=${COMP_WORDS[COMP_CWORD - 1]} command='' i
  for ((i = 1; i < COMP_CWORD; i++)); do
    [[ ${COMP_WORDS[i]} == -* ]] || { command=${COMP_WORDS[i]} && break; }
  done
  COMPREPLY=()
  case $before in
    --config | --svg | --html | --since | --merge)
      compopt -o filenames 2>/dev/null
      mapfile -t COMPREPLY < <(compgen -f -- "$word")
      return
      ;;
    --root)
      compopt -o filenames 2>/dev/null
      mapfile -t COMPREPLY < <(compgen -d -- "$word")
      return
      ;;
    --strategy)
      mapfile -t COMPREPLY < <(compgen -W "lru greedy_dual video_download" -- "$word")
      return
      ;;
    --version-tag | --locale | --session | --store | --limit | --worth | --unknown-size | --sample | --top | --every) return ;;
    --key | --size | --time | --op | --store-op | --remove-op | --clear-op) return ;;
    --chunk-second | --item-type | --priority-weight | --early-seconds) return ;;
  esac
  if [[ $word == -* ]]; then
    mapfile -t COMPREPLY < <(compgen -W "$(_cellar_options "$command")" -- "$word")
  elif [[ -z $command ]]; then
    mapfile -t COMPREPLY < <(compgen -W "demo check tune inspect verify" -- "$word")
  else
    compopt -o filenames 2>/dev/null
    case $command in
      demo | inspect | verify) mapfile -t COMPREPLY < <(compgen -d -- "$word") ;;
      *) mapfile -t COMPREPLY < <(compgen -f -- "$word") ;;
    esac
  fi
}

complete -F _cellar cellar
