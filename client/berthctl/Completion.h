// Shell completion of berthctl's own command line. The shells' completion
// scripts ask `berthctl __complete WORD...` (the words typed after
// "berthctl", the last one being completed) and offer what it prints, one
// candidate per line; so every subcommand and option berthctl knows is
// offered without the scripts listing them.
#pragma once

#include <CLI/CLI.hpp>
#include <ostream>
#include <string>
#include <vector>

namespace berth::ctl {

// The candidates for the last of `words` (possibly empty) in `app`:
// container class names after --class, option names when the word starts
// with "-", else the subcommands of the innermost subcommand named so far.
// Only candidates that start with the word are returned.
std::vector<std::string> completionCandidates(CLI::App& app, const std::vector<std::string>& words);

// Prints the candidates one per line; the exit status for berthctl.
int printCompletions(CLI::App& app, const std::vector<std::string>& words, std::ostream& out);

}  // namespace berth::ctl
