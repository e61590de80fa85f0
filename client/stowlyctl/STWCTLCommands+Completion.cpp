// stowlyctl __complete WORD...: the words that may follow a partial command line, for the
// shell's completion (stowlyctl.bash-completion). They come from the command line stowlyctl
// parses, so a new verb or option completes without anyone editing the shell script.
#include "client/stowlyctl/STWCTLCommands.h"

#include <cstdio>
#include <string>
#include <vector>

namespace {

// A subcommand takes only its own options: the global ones come before it.
const CLI::Option* optionNamed(const CLI::App* app, const std::string& word) {
    for (const CLI::Option* option : app->get_options())
        if (option->nonpositional() && option->check_name(word))
            return option;
    return nullptr;
}

std::vector<const CLI::App*> visibleSubcommands(const CLI::App* app) {
    return app->get_subcommands([](const CLI::App* sub) { return !sub->get_group().empty(); });
}

} // namespace

void STWCTLCommands::_addCompletion(CLI::App& app) {
    // An empty group keeps it out of --help.
    CLI::App* complete = app.add_subcommand("__complete", "Words that may follow WORD...")->group("");
    complete->prefix_command();
    _onRun(complete, [&app, complete](STWCTLSession&) {
        const CLI::App* current = &app;
        bool valueNext = false;
        for (const std::string& word : complete->remaining()) {
            if (valueNext) {
                valueNext = false;
                continue;
            }
            const CLI::Option* option =
                word.starts_with("-") ? optionNamed(current, word.substr(0, word.find('='))) : nullptr;
            if (option) {
                valueNext = option->get_expected_min() > 0 && word.find('=') == std::string::npos;
                continue;
            }
            for (const CLI::App* sub : visibleSubcommands(current))
                if (sub->get_name() == word)
                    current = sub;
        }
        // After an option that takes a value the shell completes file names.
        if (valueNext)
            return 0;
        std::string words;
        for (const CLI::App* sub : visibleSubcommands(current))
            words += sub->get_name() + "\n";
        for (const CLI::Option* option : current->get_options())
            for (const std::string& name : option->get_lnames())
                words += "--" + name + "\n";
        fwrite(words.data(), 1, words.size(), stdout);
        return 0;
    });
}
