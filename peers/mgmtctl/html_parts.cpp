#include "peers/mgmtctl/html_parts.h"

#include <algorithm>
#include <iterator>

void add_escaped(std::string *out, std::string_view text) {
    for (const char c : text)
        switch (c) {
        case '&':
            *out += "&amp;";
            break;
        case '<':
            *out += "&lt;";
            break;
        case '>':
            *out += "&gt;";
            break;
        case '"':
            *out += "&quot;";
            break;
        case '\'':
            *out += "&#39;";
            break;
        default:
            *out += c;
        }
}

// --- States

namespace {

struct tone {
    const char *name; // of its class
    const char *symbol;
};

const tone &find_tone(style how) {
    static const tone tones[] = {{"plain", "\u2022"}, {"plain", "\u2022"}, {"dim", "\u2013"},
                                 {"good", "\u2713"},  {"warn", "\u25b2"},  {"bad", "\u2715"}};
    return tones[static_cast<size_t>(how)];
}

} // namespace

html_markup symbol_of(style how) {
    const tone &one = find_tone(how);
    return html_of("<span class=\"sym ", one.name, "\">", one.symbol, "</span>");
}

html_markup make_badge(style how, const std::string &words) {
    const tone &one = find_tone(how);
    return html_of("<span class=\"badge ", one.name, "\"><span>", one.symbol, "</span> ", words, "</span>");
}

html_markup unknown_badge() {
    return {"<span class=\"badge unknown\"><span>?</span> unknown</span>"};
}

html_markup known_or_unknown(const std::string &text) {
    return text.empty() ? unknown_badge() : html_of(text);
}

std::string separate_by_dots(std::string words) {
    for (size_t at = 0; (at = words.find("  ", at)) != std::string::npos;)
        words.replace(at, 2, " \u00b7 ");
    return words;
}

// --- Tables

namespace {

struct table_kind {
    const char *name;
    std::vector<const char *> heads;
};

std::vector<table_kind> make_table_kinds() {
    std::vector<table_kind> kinds = {
        {"alarms", {"alarm", "group", "since", "what", "reporter"}},
        {"routers", {"router", "connection", "for", "forward", "assign", "return", "share here", "table"}},
        {"appliances", {"appliance", "weight", "wanted", "has", "share"}},
        {"intercepts", {"group", "proxy", "flows"}},
        {"tunnels", {"tunnel", "router", "local", "interface", "in", "out", "fragments", "refused"}},
        {"members", {"appliance", "passed on", "received", "delivered", "returned"}},
        {"refused", {"source", "packets", "state"}},
    };
    // One more column for each possible outcome of a packet.
    for (table_kind &kind : kinds)
        if (kind.name == std::string("intercepts"))
            for (const sorted_way &way : sorted_ways())
                kind.heads.push_back(way.shown);
    return kinds;
}

const std::vector<table_kind> &table_kinds() {
    static const std::vector<table_kind> kinds = make_table_kinds();
    return kinds;
}

} // namespace

void open_table(std::string *out, const char *name) {
    add_html(out, "<table class=\"", name, "\"><thead><tr>");
    for (const table_kind &kind : table_kinds())
        if (kind.name == std::string(name))
            for (const char *head : kind.heads)
                add_html(out, "<th scope=\"col\">", head, "</th>");
    add_html(out, "</tr></thead><tbody>");
}

void close_table(std::string *out) {
    add_html(out, "</tbody></table>\n");
}

// --- Reasons

void add_reason(std::string *out, const reason &one, bool name_group) {
    const std::string times = reason_times(one);
    add_html(out, "<div class=\"reason ", one.attention ? "warn" : "plain", "\">",
             symbol_of(one.attention ? style::warn : style::plain), "<div><p>");
    if (name_group && one.group >= 0)
        add_html(out, "<a href=\"#group-", one.group, "\">Group ", one.group, "</a> ");
    add_html(out, "<code>", one.code, "</code> ", one.cause);
    if (!times.empty())
        add_html(out, "<span class=\"dim\">, ", times, "</span>");
    add_html(out, "</p><p class=\"next\"><b>Next:</b> ", one.next, "</p></div></div>\n");
}

// --- Style

namespace {

// Colours of appliances that remain apart for colour-blind readers, each with that of its letter.
const char *const PALETTE[][2] = {{"#0072b2", "#fff"}, {"#e69f00", "#000"}, {"#009e73", "#000"},
                                  {"#cc79a7", "#000"}, {"#56b4e9", "#000"}, {"#d55e00", "#000"},
                                  {"#f0e442", "#000"}, {"#999999", "#000"}};
static_assert(std::size(PALETTE) == PAGE_COLOURS);

const char STYLE[] = R"(
:root{color-scheme:light dark;--page:#f4f6f8;--card:#fff;--line:#d5dbe3;--text:#1b2129;--dim:#586474;
--good:#0b6e55;--good-bg:#e3f4ee;--warn:#855300;--warn-bg:#fff2d1;--bad:#a9241b;--bad-bg:#fdeae7;--note-bg:#eef1f5}
@media screen and (prefers-color-scheme:dark){:root{--page:#12161b;--card:#1b2129;--line:#343d49;--text:#e6eaef;--dim:#9eabba;
--good:#6fd6b6;--good-bg:#12352c;--warn:#f3c667;--warn-bg:#3b2f12;--bad:#ff9d90;--bad-bg:#45201b;--note-bg:#262e38}}
@media print{:root{color-scheme:light}}
*{box-sizing:border-box}
html{-webkit-text-size-adjust:100%}
body{margin:0;background:var(--page);color:var(--text);font:15px/1.45 system-ui,-apple-system,"Segoe UI",Roboto,"DejaVu Sans",sans-serif;
font-variant-numeric:tabular-nums;overflow-wrap:anywhere}
main,footer{max-width:72rem;margin:0 auto;padding:0 1rem}
main{padding-top:1rem}
h1{font-size:1.5rem;line-height:1.2;margin:0}
h2{font-size:1.1rem;margin:1.8rem 0 .6rem}
h3{font-size:.95rem;margin:1.1rem 0 .4rem}
p{margin:.2rem 0}
code{font:.88em ui-monospace,"DejaVu Sans Mono",Menlo,Consolas,monospace;background:var(--note-bg);border-radius:4px;padding:.05em .35em}
a{color:inherit}
.dim{color:var(--dim)}
.made{color:var(--dim);margin-bottom:.6rem}
.made b{color:var(--text)}
.sym{flex:none;font-weight:700}
.good{color:var(--good)}.warn{color:var(--warn)}.bad{color:var(--bad)}
.head{display:flex;gap:.9rem;align-items:center;background:var(--card);border:1px solid var(--line);border-left:.5rem solid;border-radius:10px;padding:1rem 1.2rem}
.head .sym{font-size:1.9rem;line-height:1;width:1.2em;text-align:center}
.head.good{background:var(--good-bg)}.head.warn{background:var(--warn-bg)}.head.bad{background:var(--bad-bg)}
.head p{color:var(--text);margin:.3rem 0 0}
.tiles{display:grid;grid-template-columns:repeat(8,1fr);gap:.5rem;margin:.8rem 0 0;padding:0}
.tiles div{background:var(--card);border:1px solid var(--line);border-radius:10px;padding:.5rem .7rem}
.tiles dt{color:var(--dim);font-size:.8rem}
.tiles dd{margin:0;font-size:1.1rem;font-weight:600;line-height:1.3}
.tiles dd small{display:block;font-size:.8rem;font-weight:400;color:var(--dim)}
.badge{display:inline-block;border-radius:.8rem;padding:.05rem .6rem;font-size:.88em;font-weight:600;background:var(--note-bg);max-width:100%}
.badge.good{background:var(--good-bg)}.badge.warn{background:var(--warn-bg)}.badge.bad{background:var(--bad-bg)}
.badge.unknown{background:none;border:1px dashed var(--dim);color:var(--dim);font-weight:400;white-space:nowrap}
.tiles .badge{font-size:.8rem;padding:0 .5rem}
.reason{display:flex;gap:.6rem;background:var(--note-bg);border-radius:8px;padding:.5rem .8rem;margin:.45rem 0;color:var(--text)}
.reason.warn{background:var(--warn-bg)}
.reason p{margin:0}
.reason .next{margin-top:.15rem}
.card,details{background:var(--card);border:1px solid var(--line);border-radius:10px;padding:.3rem 1rem .7rem;margin:.6rem 0}
.card>h3:first-child{margin-top:.5rem}
details{padding:0}
summary{display:flex;flex-wrap:wrap;gap:.2rem .8rem;align-items:center;padding:.6rem 1rem;cursor:pointer;list-style:none}
summary::-webkit-details-marker{display:none}
summary::before{content:"\25b8";color:var(--dim);width:.8em}
details[open]>summary::before{content:"\25be"}
summary:focus-visible{outline:2px solid var(--text);border-radius:10px}
summary .id{font-size:1.1rem;font-weight:700}
summary .sum{color:var(--dim);margin-left:auto}
.body{padding:0 1rem .8rem;scroll-margin-top:4rem}
.facts{display:flex;flex-wrap:wrap;gap:.1rem 1.1rem;margin:.2rem 0;padding:0;list-style:none}
table{border-collapse:collapse;width:100%;font-size:.93em}
th{text-align:left;color:var(--dim);font-weight:400;font-size:.88em;padding:.2rem .5rem .2rem 0;border-bottom:1px solid var(--line);vertical-align:bottom}
td{padding:.28rem .5rem .28rem 0;border-bottom:1px solid var(--line);vertical-align:top}
tbody tr:last-child td{border-bottom:0}
.num{text-align:right}
th:last-child,td:last-child{padding-right:0}
.zero{color:var(--dim)}
.intercepts th:nth-child(n+3),.members th:nth-child(n+2){text-align:right}
.tunnels .num{text-align:left}
.members{width:auto;min-width:60%}
.bar{position:relative;display:block;min-width:6rem;height:1.05em;border:1px solid var(--line);border-radius:3px;background:var(--note-bg);overflow:hidden}
.bar::before{content:"";position:absolute;inset:0 auto 0 0;width:var(--has);background:var(--colour)}
.bar::after{content:"";position:absolute;top:0;bottom:0;left:calc(var(--wanted) - 1.5px);width:3px;background:var(--text);box-shadow:0 0 0 1px var(--card)}
.strips{display:grid;grid-template-columns:repeat(auto-fit,minmax(min(100%,27rem),1fr));gap:.8rem 1.4rem}
figure{margin:0;break-inside:avoid}
figcaption{margin-bottom:.3rem}
figcaption small{display:block;font-size:.85em;color:var(--dim)}
.cells{display:grid;grid-template-columns:1.9rem repeat(32,minmax(0,1fr));gap:1px;line-height:1.1rem}
.cells b{display:contents}
.cells i{font:700 .68rem/1.1rem ui-monospace,"DejaVu Sans Mono",Menlo,Consolas,monospace;text-align:center;overflow:hidden;overflow-wrap:normal;border-radius:2px}
.cells small,.legend small{color:var(--dim);font-size:.68rem}
.none>i{color:var(--dim);background:var(--note-bg)}
.other>i{outline:2px solid var(--text);outline-offset:-2px;text-decoration:underline;border-radius:0}
.legend{display:grid;grid-template-columns:repeat(auto-fit,minmax(min(100%,20rem),1fr));gap:.4rem 1.4rem}
.legend p{display:flex;flex-wrap:wrap;gap:.4rem;align-items:flex-start}
.legend p>span:last-child:not(.badge){flex:1}
.legend .cells{flex:none;display:flex}
.legend i,.key i{width:1.2rem}
.cells.key{display:inline-flex;margin-right:.3rem}
.legend .bar{flex:none;width:6rem}
footer{color:var(--dim);padding-top:1rem;padding-bottom:1.5rem;font-size:.88em}
.badge,.cells i,.bar,.bar::before,.bar::after,.head,.reason{print-color-adjust:exact;-webkit-print-color-adjust:exact}
@media screen and (max-width:62rem){.tiles{grid-template-columns:repeat(4,1fr)}}
@media screen and (max-width:46rem){
.tiles{grid-template-columns:repeat(2,1fr)}
main,footer{padding-left:.7rem;padding-right:.7rem}
.head{padding:.8rem;gap:.5rem}h1{font-size:1.25rem}
summary{padding:.6rem .7rem}summary .sum{margin-left:0;width:100%}.body,.card{padding-left:.7rem;padding-right:.7rem}
thead{position:absolute;clip-path:inset(50%);width:1px;height:1px;overflow:hidden}
table,tbody,td{display:block}
tr{display:flex;flex-wrap:wrap;gap:.05rem .9rem;padding:.4rem 0;border-bottom:1px solid var(--line)}
tbody tr:last-child{border-bottom:0}
td{border:0;padding:0;text-align:left}
td:first-child{width:100%;font-weight:600}
td::before{color:var(--dim)}
td.zero{display:none}
.appliances td:last-child{width:100%}
.cells{grid-template-columns:1.6rem repeat(32,minmax(0,1fr))}.cells i{font-size:.56rem}.other>i{outline-width:1px;outline-offset:-1px}}
@media print{html{font-size:11px}.tiles{grid-template-columns:repeat(8,1fr)}.other>i{outline-width:1px;outline-offset:-1px}body{background:#fff;font-size:11px}main,footer{max-width:none;padding:0}
.head,.reason,.tiles div{break-inside:avoid}summary{break-after:avoid}h2,h3{break-after:avoid}tr{break-inside:avoid}
.strips{grid-template-columns:1fr 1fr}}
)";

} // namespace

std::string html_style() {
    std::string out = STYLE;
    for (size_t i = 0; i < std::size(PALETTE); i++) {
        const std::string name = "o" + std::to_string(i);
        const auto &[background, text] = PALETTE[i];
        out.append(".")
            .append(name)
            .append(">i{background:")
            .append(background)
            .append(";color:")
            .append(text);
        out.append("}.bar.").append(name).append("{--colour:").append(background).append("}\n");
    }
    // On a narrow screen a row is a block: the head of each column is repeated in its cell. The first cell is
    // the block's title.
    out += "@media screen and (max-width:46rem){";
    for (const table_kind &kind : table_kinds())
        for (size_t i = 1; i < kind.heads.size(); i++)
            out += std::string(".") + kind.name + " td:nth-child(" + std::to_string(i + 1) +
                   ")::before{content:\"" + kind.heads[i] + " \"}";
    return out + "}\n";
}
