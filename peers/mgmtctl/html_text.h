// Builds HTML: string literals are markup, everything else is escaped.
#pragma once

#include <string>
#include <string_view>
#include <type_traits>

// Markup that is not escaped again.
struct html_markup {
    std::string text;
};

// For content and for attributes in double quotes.
void add_escaped(std::string *out, std::string_view text);

template <typename Piece>
void add_piece(std::string *out, const Piece &piece) {
    if constexpr (std::is_same_v<Piece, html_markup>)
        *out += piece.text;
    else if constexpr (std::is_same_v<Piece, char>)
        add_escaped(out, {&piece, 1});
    else if constexpr (std::is_arithmetic_v<Piece>)
        *out += std::to_string(piece);
    else
        add_escaped(out, piece);
}
// A literal. A buffer is not const, and does not match.
template <size_t SIZE>
void add_piece(std::string *out, const char (&markup)[SIZE]) {
    out->append(markup, SIZE - 1);
}
template <size_t SIZE>
void add_piece(std::string *out, char (&buffer)[SIZE]) = delete;

// add_html(&out, "<td title=\"", title, "\">", count, "</td>"): literals are markup, other texts are escaped.
template <typename... Pieces>
void add_html(std::string *out, Pieces &&...pieces) {
    (add_piece(out, pieces), ...);
}
template <typename... Pieces>
html_markup html_of(Pieces &&...pieces) {
    html_markup out;
    (add_piece(&out.text, pieces), ...);
    return out;
}
