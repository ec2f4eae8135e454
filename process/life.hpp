// The life of a child as one state, and what each event does in each state:
// one table, read a row for a state and a column for an event. The process
// takes every event through it and does the action that comes back, so no
// handler decides alone whether it may still act. The exit status of a child
// that ended while its output was still on its way waits in the draining
// state, the one that needs it.
#pragma once

#include <cstdint>
#include <variant>

namespace torvad {

enum class life_state : std::uint8_t {
    launching, // made, not yet running: a launch or an attach comes
    running,   // launched and watched, or serving a pipe another program made
    draining,  // the child has ended; its output is taken before its end is told
    ended,     // its end is told and it has left its owner: nothing more happens
    shut_down, // closed by the owner's shutdown: nothing more is sent or logged
};

enum class life_event : std::uint8_t {
    launched,      // the launch made a child and its exit is watched
    attached,      // a pipe another program made is bound
    launch_failed, // value: the status the requester is sent
    exited,        // value: what the child's end counts as
    output,        // value: the stream of a read that landed
    output_closed, // a read ended without bytes (closed, or cut short)
    drained,       // all the ended child's output is taken
    pipe_closed,   // the peer of an attached pipe closed its end
    stop,          // the owner asks the child to end
    shut_down,     // the owner closes everything
};

enum class life_action : std::uint8_t {
    none,
    watch,        // wait for the exit, the output and the ipc pipe; tell the requester
    serve,        // read the attached pipe
    relay,        // relay what is ready of the stream
    drain,        // take what the ended child's pipes hold
    fail,         // finish, telling the requester failed with the event's value
    close_end,    // finish, telling the requester closed with the pending status
    terminate,    // a persistent child is asked, any other is ended by force
    close_handles // close everything, the pending status with it
};

constexpr int life_states = 5;
constexpr int life_events = 10;

struct life_step {
    life_state next;
    life_action action;
};

// state x event -> the next state and what to do on the way.
extern const life_step life_table[life_states][life_events];

// The state of one child, with the status that waits in draining.
class child_life {
  public:
    life_state state() const { return static_cast<life_state>(state_.index()); }
    // Moves by the table; the action comes back with the value it acts on:
    // the event's, or for close_end the status that waited.
    struct taken {
        life_action action;
        std::uint32_t value;
    };
    taken take(life_event event, std::uint32_t value);

  private:
    struct launching {};
    struct running {};
    struct draining {
        std::uint32_t status;
    };
    struct ended {};
    struct shut_down {};
    // In life_state's order.
    std::variant<launching, running, draining, ended, shut_down> state_;
};

} // namespace torvad
