#!/bin/bash
# check-docs.sh: checks that everything quoted in the documents exists. Quotations are text in backticks, indented
# blocks and the targets of links.
#   Files     paths that begin with a directory of the tree, and bare names of source files and scripts
#   mgmtctl   commands, against peers/mgmtctl/main.cpp; their words and options, against the strings in its sources.
#             Each command has to be in docs/mgmtctl.md
#   Options   of mgmtd, tunneld and the scripts, against their sources. The manual pages have to have each
#   Variables of the environment, against the scripts and sources
#   Steps     of scripts/test.sh: each has to be in CONTRIBUTING.md
#   Keys      of JSON, and exit codes: each has to be in docs/mgmtctl.md
# Every document has to be linked from another one, and every directory to be in README.md. Unit tests compare the tables
# of reasons, metrics and nodes with the sources.
set -eu
cd "$(dirname "$0")/.."
documents=(README.md CONTRIBUTING.md CHANGELOG.md docs/*.md)
tree=$(git ls-files -co --exclude-standard)
directories=$(sed -n 's,/.*,,p' <<<"$tree" | grep -v '^\.' | sort -u | paste -sd'|')
ctl_sources=(peers/mgmtctl/*.cpp peers/nodes/*.cpp)
status=0
missing() { # DOCUMENT TEXT
    echo "$1: $2"
    status=1
}

# Prints one quotation per line. Tables have "\|" for "|".
quotations() { # DOCUMENT
    sed -n 's/\\|/|/g; s/^    \(.*\)/\1/p; t' "$1"
    grep -v '^    ' "$1" | sed 's/\\|/|/g' | grep -oE '`[^`]+`' | tr -d '`' || true
}

check_files() { # DOCUMENT
    local path
    while read -r path; do
        path=${path%[./]}
        # shellcheck disable=SC2086 # a pattern
        compgen -G "$path" >/dev/null || missing "$1" "there is no file $path"
    done < <(quotations "$1" | grep -oP "(?<![\w./~*{-])($directories)/[\w./*-]*" | sort -u)
    while read -r path; do
        grep -qE "(^|/)$path\$" <<<"$tree" || missing "$1" "there is no file $path"
    done < <(quotations "$1" | grep -oP '(?<![\w./*-])[a-z][\w-]*\.(cpp|h|sh)(?![\w(])' | sort -u)
    while read -r path; do
        [ -e "$(dirname "$1")/$path" ] || missing "$1" "the link to $path leads nowhere"
    done < <(grep -oP '\]\(\K[^)#:]+(?=[)#])' "$1" | sort -u)
}

is_text_of() { # WORD FILE... : a string, or a word of a string that lists words
    grep -qE "\"([^\"]*[ ,:[|])?$1([] ,:|=][^\"]*)?\"" "${@:2}"
}
commands=$(sed -n 's/.*add_command([a-z]*, "\([a-z]*\)".*/\1/p' peers/mgmtctl/main.cpp)
check_words() { # DOCUMENT
    local line word rest
    while read -r line; do
        read -r word rest <<<"$line"
        while [[ $word == --* || $word == \[* ]]; do
            check_option "$1" mgmtctl "${word//[][]/}"
            read -r word rest <<<"$rest"
        done
        [[ $word =~ ^[a-z]+$ ]] || continue
        grep -qx "$word" <<<"$commands" || { missing "$1" "mgmtctl has no command $word"; continue; }
        for word in ${rest//[][|\{\},;.]/ }; do
            case $word in
            --*) check_option "$1" mgmtctl "${word%%=*}" ;;
            [a-z]*) is_text_of "$word" "${ctl_sources[@]}" || missing "$1" "mgmtctl knows no word $word" ;;
            esac
        done
    # Removed before the check: separator lines, a second command, and names and files that the operator chooses.
    done < <(quotations "$1" | grep -oP '(^ *|[#$;&] |sudo )mgmtctl \K[^<>#"()]+' |
        sed -E 's/---.*//; s/[;&|] *[a-z].*//; s/\b(interface|name|password) [a-z][a-z0-9.]*/\1/g; s/ [^ ]+\.(conf|json|html)\b//g; s/:.*//' | sort -u)
}

check_option() { # DOCUMENT PROGRAM OPTION
    local sources
    case $2 in
    mgmtctl) sources=("${ctl_sources[@]}") ;;
    mgmtd | tunneld) sources=("peers/$2/main.cpp") ;;
    *) sources=("scripts/$2") ;;
    esac
    [ "$3" = -- ] || grep -qE -e "(\"|^ *|[[ ])${3%%[.,]*}\b" "${sources[@]}" || missing "$1" "$2 has no option $3"
}
check_options() { # DOCUMENT
    local program option
    while read -r program option; do
        check_option "$1" "$program" "$option"
    done < <(quotations "$1" | sed 's/"[a-z]* /"/g' | grep -E '^(mgmtd|tunneld|(sudo )?scripts/[a-z-]+\.sh)\b' |
        awk '{ sub(/^(sudo )?(scripts\/)?/, ""); for (i = 2; i <= NF && $i !~ /^[#"]/; i++)
            if (match($i, /--[a-z][a-z-]*/)) print $1, substr($i, RSTART, RLENGTH) }' | sort -u)
}

check_variables() { # DOCUMENT
    local name
    while read -r name; do
        git grep -qw "$name" -- ':!*.md' || missing "$1" "nothing reads $name"
    done < <(quotations "$1" | grep -oE '\b(LAB|FLEET|WCCP|METRICS|TUNNELD)_[A-Z_]*[A-Z]\b' | sort -u)
}
check_manual() { # PROGRAM PAGE
    local option options
    options=$(grep -oE '"--[a-z-]+"' "peers/$1/main.cpp" | tr -d '"' | sort -u)
    # The manual page of mgmtctl leaves the options of its commands to their --help.
    [ "$1" = mgmtctl ] || for option in $options; do
        grep -qF -e "${option//-/\\-}" "$2" || missing "$2" "$1 has an option $option"
    done
    for option in $(grep -oE '\\-\\-[a-z]+(\\-[a-z]+)*' "$2" | tr -d '\\' | sort -u); do
        [ "$option" = --help ] || grep -qx -e "$option" <<<"$options" || missing "$2" "$1 has no option $option"
    done
}

for document in "${documents[@]}"; do
    check_files "$document"
    check_words "$document"
    check_options "$document"
    check_variables "$document"
done
for program in mgmtd tunneld mgmtctl; do check_manual "$program" docs/man/"$program".[18]; done
for document in docs/*.md; do
    grep -qE "(docs/|\()${document##*/}" "${documents[@]}" || missing "$document" "no other document names it"
done
for directory in $(sed -n 's,/.*,,p' <<<"$tree" | grep -v '^\.' | sort -u); do
    grep -q "^|.*\`$directory/\`" README.md || missing README.md "there is a directory $directory"
done
for code in $(sed -n 's/^ *CTL_[A-Z_]* = \([0-9]*\),.*/\1/p' peers/mgmtctl/commands.h | sort -u); do
    grep -q "^| $code | " docs/mgmtctl.md || missing docs/mgmtctl.md "there is an exit code $code"
done
for key in $(grep -ohE '\{"[a-z_]+",|\["[a-z_]+"\]' peers/mgmtctl/{show,traffic}_json.cpp | grep -oE '[a-z_]+' | sort -u); do
    grep -q "\`$key\`" docs/mgmtctl.md || missing docs/mgmtctl.md "JSON has a key $key"
done
for command in $commands; do
    grep -qE "^\| [^|]*\`${command}[\` ]" docs/mgmtctl.md || missing docs/mgmtctl.md "mgmtctl has a command $command"
done
for step in $(sed -n 's/^#.*only these steps, of: //p' scripts/test.sh); do
    grep -q "\`$step\`" CONTRIBUTING.md || missing CONTRIBUTING.md "scripts/test.sh has a step $step"
done
[ $status = 0 ] || echo "check-docs.sh: the documents quote what does not exist" >&2
exit $status
