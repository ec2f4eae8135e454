// The table of a child's life.
#include "process/life.hpp"

namespace torvad {

namespace {
using enum life_state;
using enum life_action;
constexpr life_step stay_launching = {launching, none}, stay_running = {running, none},
                    stay_draining = {draining, none}, stay_ended = {ended, none},
                    stay_shut = {shut_down, none}, shut = {shut_down, close_handles};
} // namespace

// clang-format off
const life_step life_table[life_states][life_events] = {
//                launched           attached          launch_failed   exited             output             output_closed      drained              pipe_closed     stop                  shut_down
/* launching */  {{running, watch},  {running, serve}, {ended, fail},  stay_launching,    stay_launching,    stay_launching,    stay_launching,      stay_launching, stay_launching,       shut},
/* running   */  {stay_running,      stay_running,     stay_running,   {draining, drain}, {running, relay},  stay_running,      stay_running,        {ended, fail},  {running, terminate}, shut},
/* draining  */  {stay_draining,     stay_draining,    stay_draining,  stay_draining,     {draining, drain}, {draining, drain}, {ended, close_end},  stay_draining,  stay_draining,        shut},
/* ended     */  {stay_ended,        stay_ended,       stay_ended,     stay_ended,        stay_ended,        stay_ended,        stay_ended,          stay_ended,     stay_ended,           stay_ended},
/* shut_down */  {stay_shut,         stay_shut,        stay_shut,      stay_shut,         stay_shut,         stay_shut,         stay_shut,           stay_shut,      stay_shut,            stay_shut},
};
// clang-format on

child_life::taken child_life::take(life_event event, std::uint32_t value) {
    const life_step& step = life_table[state_.index()][static_cast<int>(event)];
    if (step.action == close_end)
        value = std::get<draining>(state_).status;
    if (static_cast<std::size_t>(step.next) == state_.index())
        return {step.action, value};
    switch (step.next) {
    case life_state::launching:
        state_ = launching{};
        break;
    case life_state::running:
        state_ = running{};
        break;
    case life_state::draining:
        state_ = draining{value};
        break;
    case life_state::ended:
        state_ = ended{};
        break;
    case life_state::shut_down:
        state_ = shut_down{};
        break;
    }
    return {step.action, value};
}

} // namespace torvad
