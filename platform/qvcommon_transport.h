// How state events leave our stand-in for the closed library: by this function of the program that loads it.
// If a program doesn't define it, state events are counted and dropped.
#pragma once

#include <cstdint>

struct gcl_session;

// Returns 0 if it accepts the event. Called on the thread that sends the event, with the locks that the
// thread holds.
extern "C" int qv_state_event_transport(uint32_t one, const char *group_id, uint32_t role,
                                        const uint8_t *code, struct gcl_session *session);
