// torvad-patterns decides as torvad does: each request goes to the tool's
// explain, and as an execute over a real pipe to a torvad given the same file,
// whose core (the test child) sends it.
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>

#include <boost/process.hpp>

#include "tests/e2e/harness.hpp"

using namespace e2e;

namespace {

// The tool's exit status; what it printed in out.
int explain(const std::string& file, const std::vector<std::string>& request, std::string& out) {
    namespace bp = boost::process;
    std::vector<std::string> args(tool_command.begin() + 1, tool_command.end());
    args.insert(args.end(), {"explain", file});
    args.insert(args.end(), request.begin(), request.end());
    bp::ipstream output;
    bp::child tool(tool_command[0], bp::args(args), bp::std_out > output);
    out.assign(std::istreambuf_iterator<char>(output), {});
    tool.wait();
    return tool.exit_code();
}

} // namespace

TEST(patterns_tool, explains_the_decision_torvad_makes) {
    const std::string demo = read_file(DEMO_PATTERNS);
    const std::string longest(65520 - 11, 'y'); // a whole packet behind "/bin/echo\0x"
    struct row {
        std::string patterns;
        std::vector<std::string> request; // as the tool takes it
        std::string explained;            // in what the tool prints
        systems where = systems::linux_only;
    };
    const row rows[] = {
        {demo, {"--", "uname", "-a"}, "permitted by line 4: uname\\0-[a-z]+", systems::both},
        {demo,
         {"--", "uname", "-a", "-r"},
         "refused: permission to execute denied\n"
         "    line 4 (no match): uname\\0-[a-z]+\n"
         "    line 6 (no match): (all) id\\0-un\n"},
        {demo,
         {"-u", "nobody", "--", "uname", "-a"},
         "refused: permission to change user denied\n    line 6 (no match): (all) id\\0-un\n"},
        {demo, {"-u", "nobody", "--", "id", "-un"}, "permitted by line 6: (all) id\\0-un"},
        // a bad line is skipped, never tried
        {"(\n/bin/true\n", {"--", "("}, "denied\n    line 2 (no match): /bin/true\n"},
        {"([^\\0]*)\\0\\1\n", {"--", "/bin/echo", "/bin/echo"}, "permitted by line 1"},
        {"/bin/echo\\0x.*\n", {"--", "/bin/echo", "x" + longest}, "permitted by line 1"},
        {"/bin/echo\\0x(y|y)*\\1z\n",
         {"--", "/bin/echo", "x" + longest},
         "refused: undecided within the bounds\n    line 1 (undecided)"},
    };
    const std::string core = under_wine ? "core.exe" : "core";
    for (const auto& r : rows) {
        if (!holds_here(r.where))
            continue;
        SCOPED_TRACE(r.request.back().substr(0, 20));
        scratch_dir dir;
        std::ofstream(dir.path + "/exec.patterns", std::ios::binary) << r.patterns;
        std::string out;
        int status = explain(dir.path + "/exec.patterns", r.request, out);
        EXPECT_NE(out.find(r.explained), std::string::npos) << out;
        EXPECT_EQ(status, r.explained.rfind("permitted", 0) == 0 ? 0 : 13);

        // The same items, with the flags of an execute whose output goes nowhere.
        std::ofstream requests(dir.path + "/core.execute", std::ios::binary);
        bool account = r.request[0] == "-u";
        requests << (account ? "12\n" + r.request[1] : "4") << "\n";
        for (auto item = r.request.begin() + (account ? 3 : 1); item != r.request.end(); ++item)
            requests << *item << "\n";
        requests.close();
        std::filesystem::copy(child_file, dir.path + "/" + core);
        std::vector<std::string> steps = {"?child: 1 ", "!INT", "=0", "-child: 1 failed 13",
                                          "-child: 1 failed 22"};
        if (status == 13)
            steps = {"?child: 1 failed 13", "!INT", "=0"};
        // torvad logs the refusal the tool names, or that it ran out of bounds.
        if (r.explained.starts_with("refused: undecided"))
            steps.push_back("+a pattern could not be matched within");
        else if (r.explained.starts_with("refused: "))
            steps.push_back("+" + r.explained.substr(9, r.explained.find('\n') - 9));
        run_scenario({"-d", dir.path}, steps);
    }
}
