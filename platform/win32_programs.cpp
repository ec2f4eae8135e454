// Programs that the start runs and waits for before any child is supervised,
// run with Boost.Process as the product's start has always run them: the
// program's path and its arguments on the command line, each quoted where it
// holds a blank or a double quote.
#include <windows.h>

#include <boost/filesystem/operations.hpp>
#include <boost/process/args.hpp>
#include <boost/process/child.hpp>
#include <boost/process/exe.hpp>
#include <boost/process/io.hpp>
#include <boost/process/pipe.hpp>
#include <boost/process/search_path.hpp>

#include "platform/platform.hpp"

namespace torvad::platform {

namespace {

namespace bp = boost::process;
using output_handler = std::function<void(const char*, std::size_t)>;

bp::child start_program(const std::string& path, const std::vector<std::string>& args,
                        returned_stream returned, bp::ipstream& stream) {
    if (returned == returned_stream::output)
        return bp::child(bp::exe = path, bp::args = args, bp::std_out > stream);
    if (returned == returned_stream::error)
        return bp::child(bp::exe = path, bp::args = args, bp::std_err > stream);
    return bp::child(bp::exe = path, bp::args = args);
}

} // namespace

program_end run_program(const std::string& path, const std::vector<std::string>& args,
                        returned_stream returned, const output_handler& on_output) {
    try {
        bp::ipstream stream;
        bp::child program = start_program(path, args, returned, stream);
        // Read as it comes, so the program never waits on a full pipe.
        char buffer[4096];
        while (returned != returned_stream::none && stream.read(buffer, sizeof buffer).gcount() > 0)
            on_output(buffer, static_cast<std::size_t>(stream.gcount()));
        if (!program.valid())
            return {0, -1};
        program.wait();
        return {0, program.exit_code()};
    } catch (const bp::process_error& failure) {
        return {failure.code().value() != 0 ? failure.code().value() : -1};
    }
}

// Boost's search reads PATHEXT without asking whether it is there at all;
// without it only the name itself is looked for, in each folder of PATH.
std::string search_path(const std::string& name) {
    if (GetEnvironmentVariableA("PATHEXT", nullptr, 0) != 0)
        return boost::process::search_path(name).string();
    for (const auto& folder : boost::this_process::path()) {
        boost::system::error_code error;
        auto candidate = folder / name;
        if (boost::filesystem::is_regular_file(candidate, error))
            return candidate.string();
    }
    return {};
}

} // namespace torvad::platform
