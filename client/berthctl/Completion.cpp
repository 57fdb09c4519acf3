#include "Completion.h"

#include <string_view>

#include "ExitStatus.h"
#include "core/BTHContainerClass.h"

namespace berth::ctl {

namespace {

bool startsWith(std::string_view text, std::string_view prefix) {
    return text.substr(0, prefix.size()) == prefix;
}

// The innermost subcommand the words before the last one name.
CLI::App* innermostSubcommand(CLI::App& app, const std::vector<std::string>& words) {
    CLI::App* current = &app;
    for (size_t i = 0; i + 1 < words.size(); ++i) {
        if (startsWith(words[i], "-")) continue;
        for (CLI::App* sub : current->get_subcommands({})) {
            if (sub->get_name() == words[i]) {
                current = sub;
                break;
            }
        }
    }
    return current;
}

std::vector<std::string> classNames() {
    std::vector<std::string> names;
    for (uint64_t c = 1; c < 14; ++c) names.emplace_back(BTHContainerClassName(c));
    return names;
}

// The command's own long options and, since options fall through to the
// parents (--json after a subcommand), those of its parents.
std::vector<std::string> optionNames(const CLI::App& command) {
    std::vector<std::string> names;
    for (const CLI::App* level = &command; level; level = level->get_parent())
        for (const CLI::Option* option : level->get_options())
            for (const std::string& name : option->get_lnames()) names.push_back("--" + name);
    return names;
}

std::vector<std::string> subcommandNames(CLI::App& command) {
    std::vector<std::string> names;
    for (CLI::App* sub : command.get_subcommands({}))
        if (!sub->get_name().empty() && !startsWith(sub->get_name(), "_"))
            names.push_back(sub->get_name());
    return names;
}

}  // namespace

std::vector<std::string> completionCandidates(CLI::App& app,
                                              const std::vector<std::string>& words) {
    const std::string word = words.empty() ? std::string() : words.back();
    const bool afterClassOption = words.size() >= 2 && (words[words.size() - 2] == "--class" ||
                                                        words[words.size() - 2] == "--old-class");
    CLI::App* command = innermostSubcommand(app, words);
    std::vector<std::string> all = afterClassOption        ? classNames()
                                   : startsWith(word, "-") ? optionNames(*command)
                                                           : subcommandNames(*command);
    std::vector<std::string> matching;
    for (std::string& candidate : all)
        if (startsWith(candidate, word)) matching.push_back(std::move(candidate));
    return matching;
}

int printCompletions(CLI::App& app, const std::vector<std::string>& words, std::ostream& out) {
    for (const std::string& candidate : completionCandidates(app, words)) out << candidate << '\n';
    return kExitSuccess;
}

}  // namespace berth::ctl
