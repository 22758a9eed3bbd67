// Runs nftables commands within this process. Nothing is written to the program's own output.
#pragma once

#include <nlohmann/json.hpp>
#include <string>

// Runs all of the commands as one transaction. The error is one line, with the reason that the kernel gives.
bool run_nft(const std::string &commands, std::string *out_error);
// A dry run: whether the kernel would accept the commands.
bool check_nft(const std::string &commands, std::string *out_error);
// Runs a listing command and returns the listed objects.
bool list_nft(const std::string &command, nlohmann::json *out_objects, std::string *out_error);
// Releases the connection to the kernel. The next command opens a new one.
void close_nft();
