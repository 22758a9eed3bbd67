// How state events leave the stand-in for the closed library: the program that loads it may define this, and
// then each event is handed on. A program that doesn't has its events counted and dropped.
#pragma once

#include <cstdint>

struct gcl_session;

// 0 when the event was taken. Called on the thread that sends the event, with whatever locks that one holds.
extern "C" int qv_state_event_transport(uint32_t one, const char *group_id, uint32_t role,
                                        const uint8_t *code, struct gcl_session *session);
