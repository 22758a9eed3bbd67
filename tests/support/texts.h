// Texts and files in tests.
#pragma once

#include <fstream>
#include <iterator>
#include <string>
#include <vector>

#include <gtest/gtest.h>
#include <sys/stat.h>

using strings = std::vector<std::string>;

// Whether the text contains all of the others.
template <typename... Text>
testing::AssertionResult contains(const std::string &text, const Text &...wanted) {
    for (const std::string &each : {std::string(wanted)...})
        if (text.find(each) == std::string::npos)
            return testing::AssertionFailure() << "not there: " << each << "\nin: " << text;
    return testing::AssertionSuccess();
}
// Whether it contains none of them.
template <typename... Text>
testing::AssertionResult lacks(const std::string &text, const Text &...unwanted) {
    for (const std::string &each : {std::string(unwanted)...})
        if (text.find(each) != std::string::npos)
            return testing::AssertionFailure() << "found: " << each << "\nin: " << text;
    return testing::AssertionSuccess();
}
inline std::string joined(const strings &parts, const std::string &separator) {
    std::string out;
    for (size_t i = 0; i < parts.size(); i++)
        out += (i ? separator : "") + parts[i];
    return out;
}
inline std::string text_of_file(const std::string &path) {
    std::ifstream in(path);
    return {std::istreambuf_iterator<char>(in), {}};
}
// Its permissions, -1 for none.
inline int mode_of(const std::string &path) {
    struct stat about;
    return stat(path.c_str(), &about) == 0 ? static_cast<int>(about.st_mode & 07777) : -1;
}
