# fill.awk -v VERSION=... -v NODES=docs/mgmtd.md -v HELP=FILE PAGE: prints a manual page with what is kept elsewhere
# filled in: the table of nodes from docs/mgmtd.md, and the commands as "mgmtctl --help" has them.
function plain(text) {
    gsub(/\\/, "\\e", text); gsub(/`/, "", text); gsub(/\\e\|/, "|", text); gsub(/-/, "\\-", text)
    sub(/^ +/, "", text); sub(/ +$/, "", text)
    if (text ~ /^[.']/) text = "\\&" text
    return text
}
/^@NODES@$/ {
    inside = 0
    while ((getline line < NODES) > 0) {
        if (line ~ /^## /) inside = line == "## Nodes"
        if (!inside || line !~ /^\| / || line ~ /^\| node /) continue
        gsub(/\\\|/, "\001", line)
        split(line, cell, "|")
        printf ".TP\n.B \"%s\"\n%s", plain(cell[2]), plain(cell[3])
        if (plain(cell[4]) != "") printf ", default %s", plain(cell[4])
        if (plain(cell[5]) != "") printf "; %s", plain(cell[5])
        print ""
    }
    next
}
/^@COMMANDS@$/ {
    inside = 0
    while ((getline line < HELP) > 0) {
        if (line ~ /^[A-Za-z]/) inside = line ~ /^(Subcommands|SUBCOMMANDS)/
        else if (inside && match(line, /^ +[a-z]+ +/)) {
            word = line; sub(/^ +/, "", word); sub(/ .*/, "", word)
            print ".TP\n.B " word
            print plain(substr(line, RLENGTH + 1))
        }
    }
    next
}
{ gsub(/@VERSION@/, VERSION); print }
