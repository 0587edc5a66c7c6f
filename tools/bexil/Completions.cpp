#include "Completions.h"

#include <algorithm>
#include <vector>

namespace bexil::tool {

namespace {

// What a script needs to know of one command: where it sits, what follows it, and what each option expects.
struct OptionInfo {
    std::vector<std::string> names;  // "--json", "-v"
    bool takesValue = false;
    std::string help;
};
struct CommandInfo {
    std::string path;   // the words that reach it, from the program's name: "bexil sdk show"
    std::string name;   // its own word
    std::string help;   // first line of its help
    size_t parent = 0;  // index of the command it is a subcommand of (itself for the program)
    std::vector<OptionInfo> options;
    std::vector<std::string> subcommands;
    bool takesArguments = false;
};

std::string firstLine(const std::string& text) { return text.substr(0, text.find('\n')); }

void collect(const CLI::App& app, const std::string& path, size_t parent, std::vector<CommandInfo>& commands) {
    CommandInfo command;
    command.path = path;
    command.name = app.get_name();
    command.help = firstLine(app.get_description());
    command.parent = parent;
    for (const CLI::Option* option : app.get_options()) {
        if (option->get_positional() && !option->nonpositional()) {
            command.takesArguments = true;
            continue;
        }
        OptionInfo info;
        for (const std::string& name : option->get_lnames()) info.names.push_back("--" + name);
        for (const std::string& name : option->get_snames()) info.names.push_back("-" + name);
        // Flags expect no value at all; every other option takes at least one.
        info.takesValue = option->get_expected_max() > 0;
        info.help = firstLine(option->get_description());
        command.options.push_back(std::move(info));
    }
    const size_t self = commands.size();
    commands.push_back(std::move(command));
    for (const CLI::App* sub : app.get_subcommands([](const CLI::App*) { return true; })) {
        commands[self].subcommands.push_back(sub->get_name());
        collect(*sub, path + " " + sub->get_name(), self, commands);
    }
}

std::vector<CommandInfo> commandsOf(const CLI::App& app) {
    std::vector<CommandInfo> commands;
    collect(app, app.get_name(), 0, commands);
    return commands;
}

std::string joined(const std::vector<std::string>& words) {
    std::string text;
    for (const std::string& word : words) text += (text.empty() ? "" : " ") + word;
    return text;
}

std::string optionNames(const CommandInfo& command, bool valuedOnly) {
    std::vector<std::string> names;
    for (const OptionInfo& option : command.options)
        if (option.takesValue || !valuedOnly) names.insert(names.end(), option.names.begin(), option.names.end());
    return joined(names);
}

// The tables both bash and zsh read, as associative arrays keyed by command path; valued option lists are padded
// with spaces so that a whole word can be matched with *" word "*.
std::string tables(const std::vector<CommandInfo>& commands) {
    std::string text;
    for (const char* table : {"bx_commands", "bx_options", "bx_valued", "bx_arguments"})
        text += "    local -A " + std::string(table) + "\n";
    for (const CommandInfo& command : commands) {
        // Words joined by "/": a key without spaces or quotes reads the same in both shells.
        std::string key = command.path;
        std::replace(key.begin(), key.end(), ' ', '/');
        key = "[" + key + "]=";
        text += "    bx_commands" + key + "\"" + joined(command.subcommands) + "\"\n";
        text += "    bx_options" + key + "\"" + optionNames(command, false) + "\"\n";
        text += "    bx_valued" + key + "\" " + optionNames(command, true) + " \"\n";
        if (command.takesArguments) text += "    bx_arguments" + key + "1\n";
    }
    return text;
}

std::string bashScript(const std::vector<CommandInfo>& commands) {
    return "# bash completion for bexil, written by `bexil completions bash`.\n"
           "_bexil() {\n" +
           tables(commands) +
           "    local cur=${COMP_WORDS[COMP_CWORD]} prev=${COMP_WORDS[COMP_CWORD-1]} at=bexil word i\n"
           "    for ((i = 1; i < COMP_CWORD; i++)); do\n"
           "        word=${COMP_WORDS[i]}\n"
           "        if [[ ${bx_valued[$at]} == *\" $word \"* ]]; then\n"
           "            ((i++))\n"
           "        elif [[ \" ${bx_commands[$at]} \" == *\" $word \"* ]]; then\n"
           "            at=\"$at/$word\"\n"
           "        fi\n"
           "    done\n"
           "    if [[ ${bx_valued[$at]} == *\" $prev \"* ]]; then\n"
           "        mapfile -t COMPREPLY < <(compgen -f -- \"$cur\")\n"
           "    elif [[ $cur == -* ]]; then\n"
           "        mapfile -t COMPREPLY < <(compgen -W \"${bx_options[$at]}\" -- \"$cur\")\n"
           "    else\n"
           "        mapfile -t COMPREPLY < <(compgen -W \"${bx_commands[$at]}\" -- \"$cur\")\n"
           "        if [[ -n ${bx_arguments[$at]} ]]; then\n"
           "            mapfile -t -O \"${#COMPREPLY[@]}\" COMPREPLY < <(compgen -f -- \"$cur\")\n"
           "        fi\n"
           "    fi\n"
           "}\n"
           "complete -o filenames -F _bexil bexil\n";
}

std::string zshScript(const std::vector<CommandInfo>& commands) {
    return "#compdef bexil\n"
           "# zsh completion for bexil, written by `bexil completions zsh`.\n"
           "_bexil() {\n" +
           tables(commands) +
           "    local at=bexil word i\n"
           "    for ((i = 2; i < CURRENT; i++)); do\n"
           "        word=${words[i]}\n"
           "        if [[ ${bx_valued[$at]} == *\" $word \"* ]]; then\n"
           "            ((i++))\n"
           "        elif [[ \" ${bx_commands[$at]} \" == *\" $word \"* ]]; then\n"
           "            at=\"$at/$word\"\n"
           "        fi\n"
           "    done\n"
           "    if [[ ${bx_valued[$at]} == *\" ${words[CURRENT-1]} \"* ]]; then\n"
           "        _files\n"
           "    elif [[ ${words[CURRENT]} == -* ]]; then\n"
           "        compadd -- ${=bx_options[$at]}\n"
           "    else\n"
           "        compadd -- ${=bx_commands[$at]}\n"
           "        if [[ -n ${bx_arguments[$at]} ]]; then\n"
           "            _files\n"
           "        fi\n"
           "    fi\n"
           "}\n"
           "_bexil \"$@\"\n";
}

// Fish reads single-quoted strings, in which only the quote and the backslash need escaping.
std::string fishQuoted(const std::string& text) {
    std::string quoted = "'";
    for (char c : text) {
        if (c == '\'' || c == '\\') quoted += '\\';
        quoted += c;
    }
    return quoted + "'";
}

std::string fishScript(const std::vector<CommandInfo>& commands) {
    std::string text =
        "# fish completion for bexil, written by `bexil completions fish`.\n"
        "complete -c bexil -f\n";
    for (size_t index = 0; index < commands.size(); ++index) {
        const CommandInfo& command = commands[index];
        // The program itself until a subcommand is given; a subcommand once its word is seen and none of its own.
        std::string condition = "__fish_use_subcommand";
        if (index != 0) {
            condition = "__fish_seen_subcommand_from " + command.name;
            if (!command.subcommands.empty())
                condition += "; and not __fish_seen_subcommand_from " + joined(command.subcommands);
        }
        const std::string prefix = "complete -c bexil -n " + fishQuoted(condition);
        for (const std::string& sub : command.subcommands) {
            const CommandInfo* child = nullptr;
            for (const CommandInfo& other : commands)
                if (other.parent == index && other.name == sub && &other != &command) child = &other;
            text += prefix + " -a " + sub + (child ? " -d " + fishQuoted(child->help) : "") + "\n";
        }
        for (const OptionInfo& option : command.options) {
            text += prefix;
            for (const std::string& name : option.names)
                text += (name.rfind("--", 0) == 0 ? " -l " + name.substr(2) : " -s " + name.substr(1));
            if (option.takesValue) text += " -r -F";
            text += " -d " + fishQuoted(option.help) + "\n";
        }
        if (command.takesArguments) text += prefix + " -F\n";
    }
    return text;
}

}  // namespace

std::optional<std::string> completionScript(const CLI::App& app, std::string_view shell) {
    std::vector<CommandInfo> commands = commandsOf(app);
    if (shell == "bash") return bashScript(commands);
    if (shell == "zsh") return zshScript(commands);
    if (shell == "fish") return fishScript(commands);
    return std::nullopt;
}

}  // namespace bexil::tool
