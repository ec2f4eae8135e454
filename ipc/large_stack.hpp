// Running a deeply recursive piece of work on a stack made large enough for it,
// whatever stack the caller happens to be on.
#pragma once

#include <cstddef>
#include <functional>

namespace torvad {

// Runs work on a new thread with a stack of stack_bytes and waits for it; an
// exception thrown by work is rethrown here. False when no such thread could
// be started, typically because the address space for the stack was refused.
bool run_on_large_stack(std::size_t stack_bytes, const std::function<void()>& work);

} // namespace torvad
