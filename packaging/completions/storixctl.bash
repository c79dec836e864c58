# Completion of storixctl's command line for bash. Needs nothing but bash itself.

# Lines of a command's output as what may stand here; a name may hold spaces.
_storixctl_offer() {
  local line
  while IFS= read -r line; do
    [[ $line == "$_storixctl_current"* ]] && COMPREPLY+=("$line")
  done
}

_storixctl_offer_files() { # -f, or -d for directories alone
  compopt -o filenames 2>/dev/null # fails where no completion is going on
  local line
  while IFS= read -r line; do COMPREPLY+=("$line"); done < <(compgen "$1" -- "$_storixctl_current")
}

_storixctl_offer_kind() {
  case $1 in
    DOCUMENT | FILE) _storixctl_offer_files -f ;;
    BUNDLE | DIR) _storixctl_offer_files -d ;;
    PROVIDER) _storixctl_offer < <(storixctl providers --timeout 2 2>/dev/null | cut -f 1) ;;
    CONSUMER) _storixctl_offer < <(storixctl grants 2>/dev/null | cut -f 2 | sort -u) ;;
    NAME) _storixctl_offer <<<com.tessel.mobile.vaultkeepd.first_unlock ;;
  esac
}

_storixctl() {
  local -A operands=(
    [wake]='' [providers]='' [grants]=''
    [read]='DOCUMENT' [cat]='BOOKMARK' [write]='DOCUMENT' [open]='TOKEN'
    [extend]='DOCUMENT PROVIDER CONSUMER' [placeholder]='DOCUMENT PROVIDER CONSUMER'
    [start]='DOCUMENT PROVIDER CONSUMER' [stop]='DOCUMENT PROVIDER CONSUMER'
    [share]='DOCUMENT CONSUMER' [bookmark]='DOCUMENT' [resolve]='BOOKMARK' [notify]='NAME'
    [check-extension]='BUNDLE'
  )
  local -A options=(
    [read]='--output -o' [cat]='--output -o' [open]='--output -o' [write]='--input -i'
    [grants]='--provider --consumer' [check-extension]='--item --file --container'
  )
  local _storixctl_current=${COMP_WORDS[COMP_CWORD]} verb='' option='' word i
  local -i count=0 optionsEnded=0
  COMPREPLY=()

  # Bash cuts words at "=" and ":" and makes words of these too.
  for ((i = 1; i < COMP_CWORD; ++i)); do
    word=${COMP_WORDS[i]}
    if [[ $word == : ]]; then
      ((++i))
      continue
    fi
    if ((!optionsEnded)) && [[ $word == -?* ]]; then
      case $word in
        --) optionsEnded=1 ;;
        --timeout | -o | --output | -i | --input | --provider | --consumer | --item | --file | --container)
          [[ ${COMP_WORDS[i + 1]-} == = ]] && ((++i))
          ((++i))
          if ((i >= COMP_CWORD)); then option=$word; fi
          ;;
      esac
      continue
    fi
    if [[ -z $verb ]]; then verb=$word; else ((++count)); fi
  done
  [[ -n $option && $_storixctl_current == = ]] && _storixctl_current=''

  case $option in
    '') ;;
    -o | --output | -i | --input) _storixctl_offer_kind FILE ;;
    --provider) _storixctl_offer_kind PROVIDER ;;
    --consumer) _storixctl_offer_kind CONSUMER ;;
    --container) _storixctl_offer_kind DIR ;;
  esac
  [[ -z $option ]] || return 0

  if ((!optionsEnded)) && [[ $_storixctl_current == -* ]]; then
    # shellcheck disable=SC2086 # one line for each word
    _storixctl_offer < <(printf '%s\n' --json --timeout --help -h ${verb:+${options[$verb]-}})
    return 0
  fi
  if [[ -z $verb ]]; then
    _storixctl_offer < <(printf '%s\n' "${!operands[@]}" | sort)
    return 0
  fi
  local -a kinds
  read -r -a kinds <<<"${operands[$verb]-}"
  _storixctl_offer_kind "${kinds[count]-}"
}

complete -F _storixctl storixctl
