#include "entry/patterns_tool.hpp"

#include <algorithm>
#include <cctype>
#include <chrono>
#include <map>

#include "ipc/execute.hpp"
#include "ipc/strings.hpp"

namespace torvad::patterns_tool {

const char* const usage =
    "usage: torvad-patterns check FILE\n"
    "       torvad-patterns explain FILE [-u ACCOUNT] [-r REQUESTER] -- PROGRAM [ARG...]\n";

namespace {

constexpr int status_unreadable = 2;

// What a line has to spell: the items' NUL separators as \0.
std::string spelled(std::string_view text) {
    std::string out;
    for (char c : text)
        out += c == '\0' ? std::string("\\0") : std::string(1, c);
    return out;
}

// A mistyped path must never read as "everything permitted".
bool unreadable(const patterns_file& file, report& result) {
    if (file.open_failure.empty())
        return false;
    result.err = file.open_failure + "\n" + file.open_failure_reason + "\n";
    result.status = status_unreadable;
    return true;
}

bool is_blank(char c) {
    return c == ' ' || c == '\t';
}

// The programs that read their arguments as commands of their own; a
// permitted item that no quoting can keep from running something else.
const char* const interpreters[] = {"cmd", "powershell", "pwsh", "wscript", "cscript", "mshta"};

// The pattern of the program, the first item: up to the first \0 that is not
// itself behind an escaping backslash.
std::string_view program_part(std::string_view pattern) {
    for (std::size_t i = 0; i + 1 < pattern.size(); ++i)
        if (pattern[i] == '\\' && pattern[i + 1] == '0')
            return pattern.substr(0, i);
        else if (pattern[i] == '\\')
            ++i;
    return pattern;
}

// The program's name as a literal pattern spells it: behind its last folder,
// unescaped, lower case, without anchors and an executable's suffix.
std::string literal_name(std::string_view program) {
    for (std::string_view separator : {"\\\\", "/"})
        if (std::size_t at = program.rfind(separator); at != std::string_view::npos)
            program.remove_prefix(at + separator.size());
    std::string name;
    for (char c : program)
        if (c != '\\' && c != '^' && c != '$')
            name += static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
    for (const char* suffix : {".exe", ".com"})
        if (name.ends_with(suffix))
            name.resize(name.size() - 4);
    return name;
}

std::int64_t steady_nanoseconds() {
    return std::chrono::duration_cast<std::chrono::nanoseconds>(
               std::chrono::steady_clock::now().time_since_epoch())
        .count();
}

// A line permits an interpreter when its program is spelled as one, or when
// the program's pattern takes one of the usual spellings of one.
bool permits_interpreter(std::string_view pattern) {
    std::string_view program = program_part(pattern);
    std::string literal = literal_name(program), error;
    auto regex = bounded_regex::compile(program, error);
    for (std::string name : interpreters) {
        if (literal == name)
            return true;
        std::string upper = name;
        std::transform(name.begin(), name.end(), upper.begin(),
                       [](unsigned char c) { return static_cast<char>(std::toupper(c)); });
        for (const std::string& spelled : {name, upper})
            for (const char* folder : {"", "C:\\Windows\\System32\\"})
                for (const char* suffix : {"", ".exe", ".EXE"})
                    if (regex && regex->match(folder + spelled + suffix, steady_nanoseconds) ==
                                     match_verdict::match)
                        return true;
    }
    return false;
}

// The warnings on lines that compiled: blanks that are part of the pattern,
// though an operator rarely means them, an own-account line that an "(all) "
// line repeats, which permits nothing more than that line does, and a line
// that permits a command interpreter.
void warn(const std::string& path, const pattern_lists& lists, std::string& out, int& count) {
    auto say = [&](const pattern_line& line, const std::string& what) {
        out += path + ":" + std::to_string(line.number) + ": warning: " + what + "\n    " +
               line.line + "\n";
        ++count;
    };
    std::vector<const pattern_line*> lines;
    std::map<std::string_view, unsigned> own_lines;
    for (const auto& line : lists.exec)
        own_lines.emplace(line.line, line.number);
    for (const auto* list : {&lists.exec, &lists.all})
        for (const auto& line : *list)
            lines.push_back(&line);
    std::sort(lines.begin(), lines.end(), [](auto* a, auto* b) { return a->number < b->number; });
    for (const pattern_line* line : lines) {
        bool for_all = line->line.rfind(all_prefix, 0) == 0;
        std::string_view pattern(line->line);
        pattern.remove_prefix(for_all ? all_prefix.size() : 0);
        if (!pattern.empty() && (is_blank(pattern.front()) || is_blank(pattern.back())))
            say(*line, "a blank at its start or end is part of the pattern");
        if (permits_interpreter(pattern))
            say(*line, "permits a command interpreter, which runs its arguments as commands");
        auto own = own_lines.find(pattern);
        if (for_all && own != own_lines.end())
            say(*line, "repeats line " + std::to_string(own->second) +
                           " for any account; that line permits nothing more");
    }
}

} // namespace

bool parse_command_line(const std::vector<std::string>& args, command_line& parsed) {
    if (args.size() == 2 && args[0] == "check") {
        parsed.check = true;
        parsed.path = args[1];
        return true;
    }
    if (args.size() < 2 || args[0] != "explain")
        return false;
    parsed.path = args[1];
    for (std::size_t i = 2; i < args.size(); i += 2) {
        if (args[i] == "--") {
            parsed.command.assign(args.begin() + static_cast<std::ptrdiff_t>(i) + 1, args.end());
            return !parsed.command.empty();
        }
        if (i + 1 == args.size() || (args[i] != "-u" && args[i] != "-r"))
            return false;
        if (args[i] == "-u") {
            parsed.change_account = true;
            parsed.account = args[i + 1];
        } else {
            parsed.requester = args[i + 1];
        }
    }
    return false;
}

report check(const std::string& path, const patterns_file& file) {
    report result;
    if (unreadable(file, result))
        return result;
    for (const auto& skipped : file.skipped)
        result.out += path + ":" + std::to_string(skipped.number) + ": skipped: " + skipped.reason +
                      "\n    " + skipped.line + "\n";
    int warnings = 0;
    warn(path, file.lists, result.out, warnings);
    bool clean = file.skipped.empty();
    result.out += path + ": " + std::to_string(file.lists.exec.size()) + " own-account and " +
                  std::to_string(file.lists.all.size()) + " any-account patterns, " +
                  std::to_string(file.skipped.size()) + " lines skipped, " +
                  std::to_string(warnings) + " warnings\n";
    result.status = clean ? 0 : 1;
    return result;
}

report explain(const command_line& request, const patterns_file& file, match_clock clock) {
    report result;
    if (unreadable(file, result))
        return result;
    std::vector<std::string> items = request.command;
    if (request.change_account)
        items.insert(items.begin(), request.account);
    std::string payload = join_strings(items);
    std::vector<tried_line> tried;
    // A top-level child: the daemon's own directory, which the decision doesn't read.
    execute_decision decision =
        decide_execute(request.change_account ? execute_user : 0, payload.data(), payload.size(),
                       request.requester, "", file.lists, clock, &tried);
    result.out = "text: " + spelled(join_strings(request.command)) + "\n";
    if (decision.refusal == nullptr) {
        // A file was read, so the last line tried is the one that permitted.
        result.out += "permitted by line " + std::to_string(tried.back().pattern->number) + ": " +
                      tried.back().pattern->line + "\n";
        return result;
    }
    result.status = static_cast<int>(decision.status);
    result.out += std::string("refused: ") +
                  (decision.undecided ? "undecided within the bounds" : decision.refusal) + "\n";
    for (const auto& line : tried)
        result.out += "    line " + std::to_string(line.pattern->number) + " (" +
                      (line.verdict == match_verdict::undecided ? "undecided" : "no match") +
                      "): " + line.pattern->line + "\n";
    return result;
}

} // namespace torvad::patterns_tool
