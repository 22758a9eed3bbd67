#include "peers/nodes/secrets.h"

#include <algorithm>

bool is_secret(const node_name &name) {
    return !name.parts.empty() && name.parts.back() == "password";
}

std::string hidden_value(const std::string &name, const std::string &value) {
    static const std::string label = "WCCP password";
    std::string text = value;
    // The length is hidden as well. An empty password shows that there is none.
    if (name.ends_with("/password"))
        return text.empty() ? text : HIDDEN;
    // Dumps have a line "WCCP password : ..." for each group.
    if (!name.ends_with("/debug") && !name.ends_with("/debug_all"))
        return text;
    for (size_t at = text.find(label); at != std::string::npos; at = text.find(label, at + 1)) {
        // The last line may have no newline.
        const size_t end = std::min(text.find('\n', at), text.size());
        const size_t colon = text.find(": ", at);
        // A label without a colon in its line is part of some other text.
        if (colon < end)
            text.replace(colon + 2, end - colon - 2, HIDDEN);
    }
    return text;
}

void hide_secrets(std::map<node_name, std::string> *inout) {
    for (auto &[name, text] : *inout)
        if (is_secret(name) && !text.empty())
            text = HIDDEN;
}
