#include "entry/command_line.hpp"

#include <cstdlib>

#include "ipc/packet.hpp"

namespace torvad {

namespace {

// Takes the argument behind index i, if there is one, and steps over it.
bool take_value(int argc, char** argv, int& i, const char*& value) {
    if (i + 1 >= argc)
        return false;
    value = argv[++i];
    return true;
}

void take_string(int argc, char** argv, int& i, std::string& target) {
    const char* value = nullptr;
    if (take_value(argc, argv, i, value))
        target = value;
}

} // namespace

command_line scan_command_line(int argc, char** argv) {
    command_line options;
    for (int i = 1; i < argc; ++i) {
        const char* argument = argv[i];
        if (argument[0] != '-' || argument[1] == '\0')
            continue;
        const char* value = nullptr;
        switch (argument[1]) {
        case '-':
            options.command.assign(argv + i + 1, argv + argc);
            return options;
        case 'h':
            options.help = true;
            return options;
        case 'v':
            options.verbose = true;
            break;
        case 'l':
            options.logging = true;
            break;
        case 'b':
            options.background = true;
            break;
        case 'o':
            options.no_restart = true;
            break;
        case 'r':
            options.readiness = true;
            break;
        case 'f':
            take_string(argc, argv, i, options.family);
            break;
        case 'u':
            take_string(argc, argv, i, options.user);
            break;
        case 'd':
            take_string(argc, argv, i, options.directory);
            break;
        case 'p':
            if (take_value(argc, argv, i, value))
                options.pid_file = value;
            break;
        case 'a':
            if (take_value(argc, argv, i, value))
                options.attach_pid = std::atoi(value);
            if (take_value(argc, argv, i, value))
                options.attach_pipe = std::atoi(value);
            break;
        default:
            break;
        }
    }
    return options;
}

std::string help_text(const char* program) {
    return std::string("torvad version ") + torvad_version + "\nUsage: " + program +
           " <options> -- <exe> <exe args>\n"
           "  -h  help\n"
           "  -v  verbose\n"
           "  -l  enable logging\n"
           "  -b  start service\n"
           "  -o  disable auto restart after failure\n"
           "  -r  ready once all children say so\n"
           "  -f  <product family>\n"
           "  -u  <user>\n"
           "  -d  <directory>\n"
           "  -p  <pid file>\n"
           "  -a  <pid> <pipe>\n";
}

} // namespace torvad
