// The notifications of libqvcommondyn.so, for qvcommon.cpp only. qvcommon.h documents these functions.
#pragma once

#include <cstdint>

#include "platform/qvcommon.h"

constexpr uint32_t QV_NOTIFY_KINDS = 2;

int qv_netlink_register(uint32_t kind, qv_netlink_callback callback);
int qv_netlink_start(uint32_t kind);
