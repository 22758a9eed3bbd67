// A JSON value, which a command prints or has read. The library's header takes longer to compile than any
// command, therefore only ctl_json_text.cpp includes it.
#pragma once

#include <concepts>
#include <cstddef>
#include <cstdint>
#include <initializer_list>
#include <string>
#include <vector>

struct ctl_json {
    enum class kind { null, boolean, integer, natural, real, text, array, object };
    kind type = kind::null;
    uint64_t number = 0; // a boolean or natural; an integer as the int64_t of the same bits
    double real = 0;
    std::string text;               // empty unless the value is a text
    std::vector<ctl_json> items;    // of an array or an object
    std::vector<std::string> names; // of an object, one for each item, in the order in which they were added

    ctl_json() = default;
    ctl_json(std::nullptr_t) {}
    template <std::integral T>
    ctl_json(T value)
        : type(std::same_as<T, bool>       ? kind::boolean
               : std::unsigned_integral<T> ? kind::natural
                                           : kind::integer),
          number(static_cast<uint64_t>(value)) {}
    ctl_json(double value);
    ctl_json(const char *value);
    ctl_json(std::string value);
    ctl_json(const std::vector<std::string> &values);
    // An object if each of them is an array of a text, which is the name, and a value; else an array.
    ctl_json(std::initializer_list<ctl_json> values);
    static ctl_json array();
    static ctl_json object();

    // Adds the name with null if the object does not have it. Null becomes an object.
    ctl_json &operator[](const std::string &name);
    const ctl_json &operator[](const std::string &name) const; // null if there is no such name
    bool contains(const std::string &name) const;
    void push_back(ctl_json value);     // null becomes an array
    void update(const ctl_json &other); // adds or replaces what the other object has

    bool is_null() const { return type == kind::null; }
    bool is_text() const { return type == kind::text; }
    bool is_array() const { return type == kind::array; }
    bool is_object() const { return type == kind::object; }
    bool is_whole_number() const { return type == kind::integer || type == kind::natural; }
    bool is_number() const { return is_whole_number() || type == kind::real; }
};

ctl_json text_or_null(const std::string &text); // null: the text is empty

// ASCII only; what is not UTF-8 is replaced. With an indent there is one line for each item.
std::string json_text(const ctl_json &value, int indent = -1);
// A name that an object has twice stays in it twice; operator[] finds the last one. False when the text is
// not JSON or is nested more than 100 deep.
bool parse_json(const std::string &text, ctl_json *out);
