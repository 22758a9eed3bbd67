#include "peers/tunneld/nft_commands.h"

#include <nftables/libnftables.h>

namespace {

nft_ctx *context; // kept open: closing it waits until the kernel has freed all that was deleted

bool open_nft(std::string *out_error) {
    if (context)
        return true;
    context = nft_ctx_new(NFT_CTX_DEFAULT);
    if (!context || nft_ctx_buffer_output(context) != 0 || nft_ctx_buffer_error(context) != 0) {
        close_nft();
        *out_error = "nftables: out of memory";
        return false;
    }
    // Without numeric output, names would be looked up in files like /etc/services.
    nft_ctx_output_set_flags(context, NFT_CTX_OUTPUT_JSON | NFT_CTX_OUTPUT_NUMERIC_ALL);
    return true;
}

// One line from an error of several: "Error: MESSAGE", the command, and marks below its wrong part.
std::string shorten_error(const std::string &text) {
    constexpr size_t longest_command = 200;
    size_t from = text.find("Error: ");
    from = from == std::string::npos ? 0 : from + 7;
    const size_t end = text.find('\n', from);
    std::string line = "nftables: " + text.substr(from, end - from);
    if (end == std::string::npos)
        return line;
    const std::string command = text.substr(end + 1, text.find('\n', end + 1) - end - 1);
    if (!command.empty())
        line += " in \"" + command.substr(0, longest_command) +
                (command.size() > longest_command ? "..." : "") + '"';
    return line;
}

bool run_commands(const std::string &commands, std::string *out_output, std::string *out_error) {
    if (!open_nft(out_error))
        return false;
    const bool done = nft_run_cmd_from_buffer(context, commands.c_str()) == 0;
    // Reading a buffer also empties it.
    const char *output = nft_ctx_get_output_buffer(context);
    const char *error = nft_ctx_get_error_buffer(context);
    if (out_output)
        *out_output = output ? output : "";
    if (!done)
        *out_error = shorten_error(error && *error ? error : "no reason given");
    return done;
}

} // namespace

bool run_nft(const std::string &commands, std::string *out_error) {
    return run_commands(commands, nullptr, out_error);
}

bool check_nft(const std::string &commands, std::string *out_error) {
    if (!open_nft(out_error))
        return false;
    // The kernel checks the whole transaction and then does not commit it.
    nft_ctx_set_dry_run(context, true);
    const bool fits = run_commands(commands, nullptr, out_error);
    nft_ctx_set_dry_run(context, false);
    return fits;
}

bool list_nft(const std::string &command, nlohmann::json *out_objects, std::string *out_error) {
    std::string output;
    if (!run_commands(command, &output, out_error))
        return false;
    // Without exceptions: a text that is not JSON gives a value that is not an object.
    const nlohmann::json reply = nlohmann::json::parse(output, nullptr, false);
    if (!reply.is_object() || !reply.contains("nftables") || !reply["nftables"].is_array()) {
        *out_error = "nftables: bad answer to \"" + command + '"';
        return false;
    }
    *out_objects = reply["nftables"];
    return true;
}

void close_nft() {
    if (context)
        nft_ctx_free(context);
    context = nullptr;
}
