// nftables commands, run within the process. Output and errors never reach the program's own.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

// Runs all of the commands as one transaction. The error is one line, with what the kernel says.
bool run_nft(const std::string &commands, std::string *out_error);
// The same, but the kernel only says whether it would take them.
bool check_nft(const std::string &commands, std::string *out_error);
// Runs a listing command; the objects that it lists.
bool list_nft(const std::string &command, nlohmann::json *out_objects, std::string *out_error);
// Releases the connection to the kernel. The next command opens another one.
void close_nft();
