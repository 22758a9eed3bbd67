// The table of value types, and the conversion of values from and to text.
//
// A row of the table has all that depends on the type: the size of a value, what its bytes are (its shape),
// the two functions that convert it from and to text, and its family in the wire form. What depends only on
// the shape, comparison for example, is a switch over the shapes.
//
// A number has to take the whole text and be in range, and may have a sign only if the type has one. Leading
// blanks are refused. Only the duration text ("1.5 seconds", with bn_flag_display) may have other text after
// its number. A text that can't be converted is LC_BAD_TYPE, which is not logged, because that is how bad
// input of an operator is reported; only for invalid UTF-8 the bytes are logged.
//
// All functions here are pure or allocate their result; no lock is needed.
#include "mgmt/bnode_types.h"

#include <arpa/inet.h>

#include <algorithm>
#include <bit>
#include <cctype>
#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "mgmt/bnode_rows.h"
#include "runtime/logging.h"

const lc_enum_entry bn_attribute_id_table[] = {
    {bn_attrib_value, "value"},
    {bn_attrib_none, "none"},
    {bn_attrib_product_name, "product_name"},
    {bn_attrib_module_name, "module_name"},
    {bn_attrib_module_version, "module_version"},
    {bn_attrib_node_info, "node_info"},
    {bn_attrib_capability_mask, "capability_mask"},
    {bn_attrib_revision_id, "revision_id"},
    {bn_attrib_node_count, "node_count"},
    {0, nullptr},
};

// --- Numbers

lc_status bn_text_to_natural(const char *text, uint64_t limit, uint64_t *out) {
    // strtoul would accept leading blanks and a sign.
    if (!isdigit(static_cast<unsigned char>(*text)))
        return LC_BAD_TYPE;
    char *end = nullptr;
    errno = 0;
    *out = strtoul(text, &end, 10);
    return errno || *end || *out > limit ? LC_BAD_TYPE : LC_OK;
}
lc_status bn_text_to_integer(const char *text, int64_t least, int64_t most, int64_t *out) {
    const bool is_signed = *text == '-' || *text == '+';
    if (!isdigit(static_cast<unsigned char>(text[is_signed ? 1 : 0])))
        return LC_BAD_TYPE;
    char *end = nullptr;
    errno = 0;
    *out = strtol(text, &end, 10);
    return errno || *end || *out < least || *out > most ? LC_BAD_TYPE : LC_OK;
}

namespace {

template <typename Number>
Number load_value(const bn_attrib *attrib) {
    Number value;
    memcpy(&value, attrib->value.bytes, sizeof value);
    return value;
}

} // namespace

uint64_t bn_value_natural(const bn_type_row *row, const bn_attrib *attrib) {
    switch (row->size) {
    case 1:
        return load_value<uint8_t>(attrib);
    case 2:
        return load_value<uint16_t>(attrib);
    case 4:
        return load_value<uint32_t>(attrib);
    case 8:
        return load_value<uint64_t>(attrib);
    default:
        return 0;
    }
}
int64_t bn_value_integer(const bn_type_row *row, const bn_attrib *attrib) {
    // Extends the sign of a shorter value to 64 bits.
    const uint64_t value = bn_value_natural(row, attrib);
    const int unused = 64 - 8 * row->size;
    return static_cast<int64_t>(value << unused) >> unused;
}

namespace {

void store_number(const bn_type_row *row, uint64_t value, bn_attrib *attrib) {
    static_assert(std::endian::native == std::endian::little);
    // The low bytes come first, so that a shorter type gets the low part of the value.
    memcpy(attrib->value.bytes, &value, std::min<size_t>(row->size, sizeof value));
}

lc_status natural_to_text(const bn_type_row *row, const bn_attrib *attrib, char **out) {
    return bn_give_text(smprintf("%lu", bn_value_natural(row, attrib)), out);
}
lc_status natural_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    uint64_t value = 0;
    // The limit has as many ones as the type has bits.
    CHECK_QUIET(bn_text_to_natural(text, UINT64_MAX >> (64 - 8 * row->size), &value));
    store_number(row, value, attrib);
    return LC_OK;
}
lc_status integer_to_text(const bn_type_row *row, const bn_attrib *attrib, char **out) {
    return bn_give_text(smprintf("%ld", bn_value_integer(row, attrib)), out);
}
lc_status integer_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    const int64_t most = INT64_MAX >> (64 - 8 * row->size);
    int64_t value = 0;
    CHECK_QUIET(bn_text_to_integer(text, -most - 1, most, &value));
    store_number(row, static_cast<uint64_t>(value), attrib);
    return LC_OK;
}
lc_status bool_to_text(const bn_type_row *row, const bn_attrib *attrib, char **out) {
    return bn_give_text(safe_strdup(lc_bool_to_str(bn_value_natural(row, attrib) != 0)), out);
}
lc_status bool_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    int32_t value = 0;
    CHECK_QUIET(lc_str_to_bool(text, &value));
    store_number(row, value != 0, attrib);
    return LC_OK;
}
template <typename Real>
Real parse_real(const char *text, char **end) {
    if constexpr (sizeof(Real) == sizeof(float))
        return strtof(text, end);
    else
        return strtod(text, end);
}
template <typename Real>
lc_status real_to_text(const bn_type_row *row, const bn_attrib *attrib, char **out) {
    const double value = static_cast<double>(load_value<Real>(attrib));
    return bn_give_text(row->size == sizeof(float) ? smprintf("%.9f", value) : smprintf("%.18g", value), out);
}
template <typename Real>
lc_status real_from_text(const bn_type_row *, const char *text, bn_attrib *attrib) {
    char *end = nullptr;
    errno = 0;
    const Real value = parse_real<Real>(text, &end);
    // errno is set for an underflow too; such a text is refused instead of becoming 0.
    if (errno || end == text || *end || isspace(static_cast<unsigned char>(*text)))
        return LC_BAD_TYPE;
    memcpy(attrib->value.bytes, &value, sizeof value);
    return LC_OK;
}
lc_status char_to_text(const bn_type_row *, const bn_attrib *attrib, char **out) {
    return bn_give_text(smprintf("%c", load_value<char>(attrib)), out);
}
lc_status char_from_text(const bn_type_row *, const char *text, bn_attrib *attrib) {
    if (strlen(text) != 1)
        return LC_BAD_TYPE;
    attrib->value.bytes[0] = static_cast<uint8_t>(text[0]);
    return LC_OK;
}
// A number that is written as a name. The row's form is the table of names; bn_type_table, which is derived
// from the rows themselves, is used if it is null.
const lc_enum_entry *names_of(const bn_type_row *row) {
    return row->form ? static_cast<const lc_enum_entry *>(row->form) : bn_type_table;
}
lc_status named_to_text(const bn_type_row *row, const bn_attrib *attrib, char **out) {
    const auto value = static_cast<int32_t>(bn_value_natural(row, attrib));
    return bn_give_text(safe_strdup(lc_enum_to_string_quiet(names_of(row), value)), out);
}
lc_status named_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    int32_t value = 0;
    CHECK_QUIET(lc_string_to_enum(names_of(row), text, &value));
    store_number(row, static_cast<uint32_t>(value), attrib);
    return LC_OK;
}

// --- Times. The row's form is a time_form.

struct time_form {
    int64_t unit_us;
    lc_status (*to_str)(int64_t us, char **out);
    lc_status (*from_str)(const char *text, int64_t *out_us);
    bool plain_without_display; // durations are plain numbers unless bn_flag_display is set
};
lc_status datetime_to_str(int64_t us, char **out) {
    return lt_datetime_us_to_str(us, 0, out);
}
constexpr int64_t SEC = 1000000, MS = 1000, US = 1;
// Defines daytime_sec_form, daytime_ms_form and daytime_us_form for example.
#define TIME_FORMS(kind, to, plain)                                                                          \
    constexpr time_form kind##_sec_form = {SEC, to, lt_str_to_##kind##_us, plain};                           \
    constexpr time_form kind##_ms_form = {MS, to, lt_str_to_##kind##_us, plain};                             \
    constexpr time_form kind##_us_form = {US, to, lt_str_to_##kind##_us, plain};
TIME_FORMS(daytime, lt_daytime_us_to_str, false)
TIME_FORMS(datetime, datetime_to_str, false)
TIME_FORMS(dur, lt_dur_us_to_str, true)

bool is_plain_duration(const time_form *form, const bn_attrib *attrib) {
    return form->plain_without_display && !(attrib->type_flags & bn_flag_display);
}
lc_status time_to_text(const bn_type_row *row, const bn_attrib *attrib, char **out) {
    const auto *form = static_cast<const time_form *>(row->form);
    const bool natural = row->shape == value_shape::natural;
    if (is_plain_duration(form, attrib))
        return natural ? natural_to_text(row, attrib, out) : integer_to_text(row, attrib, out);
    const int64_t value =
        natural ? static_cast<int64_t>(bn_value_natural(row, attrib)) : bn_value_integer(row, attrib);
    int64_t us = 0;
    CHECK_CONDITION(!__builtin_mul_overflow(value, form->unit_us, &us));
    CHECK_STATUS(form->to_str(us, out));
    return LC_OK;
}
lc_status time_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    const auto *form = static_cast<const time_form *>(row->form);
    const bool natural = row->shape == value_shape::natural;
    if (is_plain_duration(form, attrib))
        return natural ? natural_from_text(row, text, attrib) : integer_from_text(row, text, attrib);
    int64_t us = 0;
    CHECK_QUIET(form->from_str(text, &us));
    // The limits of the lt_str_to_..._sec and _ms functions, which would log a failure.
    if ((form->unit_us != US && us < 0) || (form->unit_us == SEC && us / SEC > INT32_MAX))
        return LC_BAD_TYPE;
    store_number(row, static_cast<uint64_t>(us / form->unit_us), attrib);
    return LC_OK;
}
lc_status date_to_text(const bn_type_row *, const bn_attrib *attrib, char **out) {
    CHECK_STATUS(lt_date_to_str(load_value<lt_date>(attrib), out));
    return LC_OK;
}
lc_status date_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    lt_date value = 0;
    CHECK_QUIET(lt_str_to_date(text, &value));
    store_number(row, value, attrib);
    return LC_OK;
}

// --- Addresses

template <typename Value, lc_status (*ToStr)(const Value *, char **)>
lc_status record_to_text(const bn_type_row *, const bn_attrib *attrib, char **out) {
    const Value value = load_value<Value>(attrib);
    CHECK_STATUS(ToStr(&value, out));
    return LC_OK;
}
template <typename Value, lc_status (*ToStr)(Value, char **)>
lc_status word_to_text(const bn_type_row *, const bn_attrib *attrib, char **out) {
    CHECK_STATUS(ToStr(load_value<Value>(attrib), out));
    return LC_OK;
}
template <typename Value, lc_status (*FromStr)(const char *, Value *)>
lc_status record_from_text(const bn_type_row *, const char *text, bn_attrib *attrib) {
    Value value{};
    CHECK_QUIET(FromStr(text, &value));
    memcpy(attrib->value.bytes, &value, sizeof value);
    return LC_OK;
}
lc_status ipv6_to_str(const lc_ipv6addr *value, char **out) {
    char text[INET6_ADDRSTRLEN];
    CHECK_NULL(inet_ntop(AF_INET6, value->bytes, text, sizeof text));
    return bn_give_text(safe_strdup(text), out);
}
lc_status text_to_ipv6(const char *text, lc_ipv6addr *out) {
    return inet_pton(AF_INET6, text, out->bytes) == 1 ? LC_OK : LC_BAD_TYPE;
}
lc_status ipv6prefix_to_str(const lc_ipv6prefix *value, char **out) {
    char text[INET6_ADDRSTRLEN];
    CHECK_NULL(inet_ntop(AF_INET6, value->address, text, sizeof text));
    return bn_give_text(smprintf("%s/%u", text, value->mask_length), out);
}
lc_status text_to_ipv6prefix(const char *text, lc_ipv6prefix *out) {
    lc_ipprefix prefix{};
    // The general conversion also takes IPv4 and a missing length.
    if (!strchr(text, ':') || !strchr(text, '/') || bn_text_to_ipprefix(text, &prefix) != LC_OK)
        return LC_BAD_TYPE;
    memcpy(out->address, prefix.address, sizeof out->address);
    out->mask_length = prefix.mask_length;
    return LC_OK;
}

// --- Allocated values and none

lc_status none_to_text(const bn_type_row *, const bn_attrib *, char **out) {
    return bn_give_text(safe_strdup(""), out);
}
lc_status none_from_text(const bn_type_row *, const char *, bn_attrib *) {
    return LC_OK;
}
lc_status refuse_to_text(const bn_type_row *, const bn_attrib *, char **) {
    FAIL_WITH(LC_UNEXPECTED_CASE);
}
lc_status refuse_from_text(const bn_type_row *, const char *, bn_attrib *) {
    FAIL_WITH(LC_UNEXPECTED_CASE);
}
lc_status string_to_text(const bn_type_row *, const bn_attrib *attrib, char **out) {
    return bn_give_text(safe_strdup(attrib->value.string ? attrib->value.string->buffer : ""), out);
}
lc_status string_from_text(const bn_type_row *, const char *text, bn_attrib *attrib) {
    CHECK_STATUS(ts_new_str(&attrib->value.string, text));
    attrib->value_size = static_cast<uint32_t>(ts_length(attrib->value.string));
    return LC_OK;
}
lc_status utf8_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    CHECK_STATUS(string_from_text(row, text, attrib));
    const lc_status status = ts_set_utf8(attrib->value.string, 1);
    return status == LC_BAD_UTF8 ? LC_BAD_TYPE : status;
}
lc_status hostname_from_text(const bn_type_row *row, const char *text, bn_attrib *attrib) {
    if (text[0] == '-')
        return LC_BAD_TYPE;
    for (const char *at = text; *at; at++) // ASCII only; isalnum() depends on the locale
        if (!((*at | 0x20) >= 'a' && (*at | 0x20) <= 'z') && !(*at >= '0' && *at <= '9') && *at != '-' &&
            *at != '.')
            return LC_BAD_TYPE;
    return string_from_text(row, text, attrib);
}
lc_status binary_to_text(const bn_type_row *, const bn_attrib *attrib, char **out) {
    const tbuffer *bytes = attrib->value.binary;
    // A buffer always has a NUL after its last byte; the text ends at the first one.
    return bn_give_text(safe_strdup(bytes ? reinterpret_cast<const char *>(bytes->buffer) : ""), out);
}
lc_status binary_from_text(const bn_type_row *, const char *text, bn_attrib *attrib) {
    CHECK_STATUS(tb_new_buf(&attrib->value.binary, text, -1));
    attrib->value_size = static_cast<uint32_t>(tb_length(attrib->value.binary));
    return LC_OK;
}

// --- The table

using shape = value_shape;
// The columns are those of bn_type_row. Durations are numeric; dates and times are not. Only "any", which no
// attribute has, is without a wire form.
constexpr bn_type_row rows[] = {
    {bn_type_uint8, "uint8", 1, shape::natural, true, natural_to_text, natural_from_text, wire_number,
     nullptr},
    {bn_type_int8, "int8", 1, shape::integer, true, integer_to_text, integer_from_text, wire_number, nullptr},
    {bn_type_uint16, "uint16", 2, shape::natural, true, natural_to_text, natural_from_text, wire_number,
     nullptr},
    {bn_type_int16, "int16", 2, shape::integer, true, integer_to_text, integer_from_text, wire_number,
     nullptr},
    {bn_type_uint32, "uint32", 4, shape::natural, true, natural_to_text, natural_from_text, wire_number,
     nullptr},
    {bn_type_int32, "int32", 4, shape::integer, true, integer_to_text, integer_from_text, wire_number,
     nullptr},
    {bn_type_uint64, "uint64", 8, shape::natural, true, natural_to_text, natural_from_text, wire_number,
     nullptr},
    {bn_type_int64, "int64", 8, shape::integer, true, integer_to_text, integer_from_text, wire_number,
     nullptr},
    {bn_type_bool, "bool", 4, shape::natural, false, bool_to_text, bool_from_text, wire_number, nullptr},
    {bn_type_float32, "float32", 4, shape::real, true, real_to_text<float>, real_from_text<float>,
     wire_number, nullptr},
    {bn_type_float64, "float64", 8, shape::real, true, real_to_text<double>, real_from_text<double>,
     wire_number, nullptr},
    {bn_type_char, "char", 1, shape::natural, false, char_to_text, char_from_text, wire_number, nullptr},
    {bn_type_ipaddr, "ipaddr", sizeof(lc_ipaddr), shape::ipaddr, false,
     record_to_text<lc_ipaddr, lc_ipaddr_to_str>, record_from_text<lc_ipaddr, bn_text_to_ipaddr>, wire_ipaddr,
     nullptr},
    {bn_type_ipprefix, "ipprefix", sizeof(lc_ipprefix), shape::ipprefix, false,
     record_to_text<lc_ipprefix, lc_ipprefix_to_str>, record_from_text<lc_ipprefix, bn_text_to_ipprefix>,
     wire_ipprefix, nullptr},
    {bn_type_ipv4addr, "ipv4addr", 4, shape::natural, false, word_to_text<uint32_t, lc_ipv4addr_to_str>,
     record_from_text<uint32_t, lc_str_to_ipv4addr>, wire_number, nullptr},
    {bn_type_ipv4prefix, "ipv4prefix", 8, shape::natural, false, word_to_text<uint64_t, lc_ipv4prefix_to_str>,
     record_from_text<uint64_t, lc_str_to_ipv4prefix>, wire_number, nullptr},
    {bn_type_macaddr802, "macaddr802", 6, shape::bytes, false,
     record_to_text<lc_macaddr802, lc_macaddr802_to_str>,
     record_from_text<lc_macaddr802, lc_str_to_macaddr802>, wire_bytes, nullptr},
    {bn_type_ipv6addr, "ipv6addr", 16, shape::bytes, false, record_to_text<lc_ipv6addr, ipv6_to_str>,
     record_from_text<lc_ipv6addr, text_to_ipv6>, wire_number, nullptr},
    {bn_type_ipv6prefix, "ipv6prefix", 17, shape::bytes, false,
     record_to_text<lc_ipv6prefix, ipv6prefix_to_str>, record_from_text<lc_ipv6prefix, text_to_ipv6prefix>,
     wire_number, nullptr},
    {bn_type_date, "date", 4, shape::natural, false, date_to_text, date_from_text, wire_number, nullptr},
    {bn_type_time_sec, "time_sec", 4, shape::natural, false, time_to_text, time_from_text, wire_number,
     &daytime_sec_form},
    {bn_type_time_ms, "time_ms", 8, shape::integer, false, time_to_text, time_from_text, wire_number,
     &daytime_ms_form},
    {bn_type_time_us, "time_us", 8, shape::integer, false, time_to_text, time_from_text, wire_number,
     &daytime_us_form},
    {bn_type_datetime_sec, "datetime_sec", 4, shape::natural, false, time_to_text, time_from_text,
     wire_number, &datetime_sec_form},
    {bn_type_datetime_ms, "datetime_ms", 8, shape::integer, false, time_to_text, time_from_text, wire_number,
     &datetime_ms_form},
    {bn_type_datetime_us, "datetime_us", 8, shape::integer, false, time_to_text, time_from_text, wire_number,
     &datetime_us_form},
    {bn_type_duration_sec, "duration_sec", 4, shape::natural, true, time_to_text, time_from_text, wire_number,
     &dur_sec_form},
    {bn_type_duration_ms, "duration_ms", 8, shape::integer, true, time_to_text, time_from_text, wire_number,
     &dur_ms_form},
    {bn_type_duration_us, "duration_us", 8, shape::integer, true, time_to_text, time_from_text, wire_number,
     &dur_us_form},
    {bn_type_none, "none", 0, shape::none, false, none_to_text, none_from_text, wire_number, nullptr},
    {bn_type_any, "any", 0, shape::none, false, refuse_to_text, refuse_from_text, {}, nullptr},
    {bn_type_btype, "btype", 4, shape::natural, false, named_to_text, named_from_text, wire_number, nullptr},
    {bn_type_attribute, "attribute", 4, shape::natural, false, named_to_text, named_from_text, wire_number,
     bn_attribute_id_table},
    {bn_type_str, "string", 0, shape::text, false, string_to_text, string_from_text, wire_counted, nullptr},
    {bn_type_utf8_string, "utf8_string", 0, shape::text, false, string_to_text, utf8_from_text, wire_counted,
     nullptr},
    {bn_type_binary, "binary", 0, shape::binary, false, binary_to_text, binary_from_text, wire_counted,
     nullptr},
    {bn_type_oid, "oid", 0, shape::text, false, string_to_text, string_from_text, wire_counted, nullptr},
    {bn_type_link, "link", 0, shape::text, false, string_to_text, string_from_text, wire_counted, nullptr},
    {bn_type_name, "name", 0, shape::text, false, string_to_text, string_from_text, wire_counted, nullptr},
    {bn_type_hostname, "hostname", 0, shape::text, false, string_to_text, hostname_from_text, wire_counted,
     nullptr},
    {bn_type_uri, "uri", 0, shape::text, false, string_to_text, string_from_text, wire_counted, nullptr},
    {bn_type_charlist, "charlist", 0, shape::text, false, string_to_text, string_from_text, wire_counted,
     nullptr},
    {bn_type_regex, "regex", 0, shape::text, false, string_to_text, string_from_text, wire_counted, nullptr},
    {bn_type_globpattern, "globpattern", 0, shape::text, false, string_to_text, string_from_text,
     wire_counted, nullptr},
};
constexpr size_t ROW_COUNT = sizeof rows / sizeof rows[0];

// Tables for lookup by number and by name, derived from the rows at compile time.
struct derived_tables {
    lc_enum_entry names[ROW_COUNT + 1];
    bn_attrib_copy_func wire[BN_TYPE_LAST + 1];
    const bn_type_row *by_number[BN_TYPE_LAST + 1];
};
constexpr derived_tables derive_tables() {
    derived_tables tables{};
    for (size_t i = 0; i < ROW_COUNT; i++) {
        tables.names[i] = {static_cast<int32_t>(rows[i].number), rows[i].name};
        if (rows[i].wire.kind)
            tables.wire[rows[i].number] = {bn_wire_write, bn_wire_read};
        tables.by_number[rows[i].number] = &rows[i];
    }
    return tables;
}
constexpr derived_tables tables = derive_tables();

} // namespace

const lc_enum_entry *const bn_type_table = tables.names;
const bn_attrib_copy_func *const bn_attrib_copy_funcs = tables.wire;

const bn_type_row *bn_type_find(uint32_t type_and_flags) {
    const uint32_t type = type_and_flags & BN_TYPE_MASK;
    return type <= BN_TYPE_LAST ? tables.by_number[type] : nullptr;
}

// --- Predicates and comparison

namespace {

const bn_type_row *row_with_value(uint32_t type_and_flags) {
    return type_and_flags & bn_flag_no_value ? nullptr : bn_type_find(type_and_flags);
}

} // namespace

bool bn_type_numeric(uint32_t type_and_flags) {
    const bn_type_row *row = row_with_value(type_and_flags);
    return row && row->numeric;
}
bool bn_type_string(uint32_t type_and_flags) {
    const bn_type_row *row = row_with_value(type_and_flags);
    return row && row->shape == value_shape::text;
}
bool bn_type_tbuf(uint32_t type_and_flags) {
    const bn_type_row *row = row_with_value(type_and_flags);
    return row && row->shape == value_shape::binary;
}
bool bn_type_allocs(uint32_t type_and_flags) {
    return bn_type_string(type_and_flags) || bn_type_tbuf(type_and_flags);
}
uint32_t bn_type_fixed_size(uint32_t type_and_flags) {
    const bn_type_row *row = row_with_value(type_and_flags);
    return row ? row->size : 0;
}

namespace {

template <typename Number>
int compare_ordered(Number a, Number b) {
    return (a > b) - (a < b);
}
int compare_binary(const tbuffer *a, const tbuffer *b) {
    if (!a || !b)
        return (a ? 0 : 1) - (b ? 0 : 1);
    const int result = memcmp(a->buffer, b->buffer, std::min(a->length, b->length));
    return result ? result : compare_ordered(a->length, b->length);
}

} // namespace

int bn_value_compare(const bn_type_row *row, const bn_attrib *a, const bn_attrib *b) {
    switch (row->shape) {
    case value_shape::none:
        return 0;
    case value_shape::natural:
        return compare_ordered(bn_value_natural(row, a), bn_value_natural(row, b));
    case value_shape::integer:
        return compare_ordered(bn_value_integer(row, a), bn_value_integer(row, b));
    case value_shape::real:
        return row->size == sizeof(float) ? compare_ordered(load_value<float>(a), load_value<float>(b))
                                          : compare_ordered(load_value<double>(a), load_value<double>(b));
    case value_shape::bytes:
        return memcmp(a->value.bytes, b->value.bytes, row->size);
    case value_shape::ipaddr: {
        const lc_ipaddr left = load_value<lc_ipaddr>(a), right = load_value<lc_ipaddr>(b);
        return lc_ipaddr_compare(&left, &right);
    }
    case value_shape::ipprefix: {
        const lc_ipprefix left = load_value<lc_ipprefix>(a), right = load_value<lc_ipprefix>(b);
        return lc_ipprefix_compare(&left, &right);
    }
    case value_shape::text:
        return ts_cmp(a->value.string, b->value.string);
    case value_shape::binary:
        return compare_binary(a->value.binary, b->value.binary);
    }
    return 0;
}
