// Owners of objects in tests.
#pragma once

#include <cstdlib>
#include <memory>
#include <string>

template <typename T, auto Free>
struct owner {
    T *pointer = nullptr;
    owner() = default;
    owner(const owner &) = delete;
    owner &operator=(const owner &) = delete;
    ~owner() { reset(); }
    void reset() {
        (void)Free(&pointer);
        pointer = nullptr;
    }
    T **operator&() {
        reset();
        return &pointer;
    }
    T *operator->() const { return pointer; }
    operator T *() const { return pointer; }
};

// The text that `call(&text)` outputs; the original is freed.
template <typename Call>
std::string text_of(Call call) {
    char *text = nullptr;
    if (call(&text) != 0)
        return "(failed)";
    const std::string copy = text ? text : "(null)";
    free(text);
    return copy;
}
