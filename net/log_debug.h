// Debug lines of the transport sit on its data path (one per byte run, tag or value). When the
// process logs below debug level the level test here saves the variadic call entirely; the line
// itself is the same Logger::LogMsg call either way.
#ifndef S2S_NET_LOG_DEBUG_H
#define S2S_NET_LOG_DEBUG_H

#include "s2s_logger.h"

#define S2S_LOG_DEBUG(...)                                            \
    do {                                                              \
        if (::S2S::Logger::log_level >= ::S2S::Logger::Debug) {       \
            ::S2S::Logger::LogMsg(::S2S::Logger::Debug, __VA_ARGS__); \
        }                                                             \
    } while (0)

#endif  // S2S_NET_LOG_DEBUG_H
