#include "tests/e2e/harness.hpp"

#include <gtest/gtest.h>

#include <cctype>
#include <chrono>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <random>
#include <sstream>
#include <thread>

namespace e2e {

const char* const torvad_binary = TORVAD_BINARY;
const char* const child_binary = TEST_CHILD_BINARY;

namespace {

using clock = std::chrono::steady_clock;

int remaining_ms(clock::time_point deadline) {
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(deadline - clock::now());
    return left.count() > 0 ? static_cast<int>(left.count()) : 0;
}

} // namespace

bool daemon_run::wait_for(const std::string& text, int timeout_ms) {
    auto deadline = clock::now() + std::chrono::milliseconds(timeout_ms);
    for (;;) {
        auto found = output_.find(text, cursor_);
        if (found != std::string::npos) {
            cursor_ = found + text.size();
            return true;
        }
        if (!read_some(remaining_ms(deadline)) && (eof_ || remaining_ms(deadline) == 0))
            return false;
    }
}

bool daemon_run::wait_anywhere(const std::string& text, int timeout_ms) {
    std::size_t kept = cursor_;
    cursor_ = 0;
    bool found = wait_for(text, timeout_ms);
    cursor_ = kept;
    return found;
}

std::string daemon_run::wait_value(const std::string& key, int timeout_ms) {
    if (!wait_for(key + "=", timeout_ms))
        return {};
    std::size_t end = cursor_;
    while (end < output_.size() && !std::isspace(static_cast<unsigned char>(output_[end])))
        ++end;
    std::string value = output_.substr(cursor_, end - cursor_);
    cursor_ = end;
    return value;
}

void run_scenario(const std::vector<std::string>& args, const std::vector<std::string>& steps,
                  const options& how, const step_hook& hook) {
    daemon_run run(args, how);
    int child = -1;
    for (const auto& step : steps) {
        std::string text = step.substr(1);
        if (hook && hook(step, run))
            continue;
        if (step[0] == '?')
            EXPECT_TRUE(run.wait_for(text)) << "waited for: " << text << "\n" << run.output();
        else if (step == "!GROUP")
            run.interrupt_group();
        else if (step[0] == '!')
            run.signal(text == "INT" ? SIGINT : SIGTERM);
        else if (step[0] == 'M')
            EXPECT_LT(peak_memory_kib(run.pid()), std::atoi(text.c_str()) * 1024);
        else if (step[0] == '#')
            child = std::atoi(run.wait_value(text).c_str());
        else if (step.rfind("kill ", 0) == 0 && child > 0)
            kill_process(child, std::atoi(step.c_str() + 5));
        else if (step[0] == '=')
            EXPECT_EQ(run.wait_exit(), std::atoi(text.c_str())) << run.output();
        else if (step == "Z")
            EXPECT_EQ(zombie_children(run.pid()), 0);
        else if (step == "z")
            EXPECT_TRUE(no_zombie_within(run.pid(), event_wait_ms)) << run.output();
        else if (step[0] == '&')
            EXPECT_TRUE(run.wait_anywhere(text)) << "waited for: " << text << "\n" << run.output();
        else if (step[0] == '+')
            EXPECT_NE(run.output().find(text), std::string::npos) << text << "\n" << run.output();
        else if (step[0] == '-')
            EXPECT_EQ(run.output().find(text), std::string::npos) << text << "\n" << run.output();
        else
            ADD_FAILURE() << "bad step " << step;
    }
}

scratch_dir::scratch_dir() {
    std::random_device random;
    auto base = std::filesystem::temp_directory_path();
    do
        path = (base / ("torvad-test-" + std::to_string(random()))).generic_string();
    while (!std::filesystem::create_directory(path));
}

scratch_dir::~scratch_dir() {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
}

// A zombie is reaped by the loop's next turn; nothing tells us when that was.
bool no_zombie_within(int pid, int timeout_ms) {
    auto deadline = clock::now() + std::chrono::milliseconds(timeout_ms);
    while (zombie_children(pid) != 0) {
        if (clock::now() > deadline)
            return false;
        std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
    return true;
}

std::vector<std::string> child(std::vector<std::string> mode, std::vector<std::string> options) {
    options.insert(options.end(), {"--", child_binary});
    options.insert(options.end(), mode.begin(), mode.end());
    return options;
}

bool file_exists(const std::string& path) {
    std::error_code ignored;
    return std::filesystem::exists(path, ignored);
}

std::string read_file(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    std::stringstream text;
    text << file.rdbuf();
    return text.str();
}

} // namespace e2e
