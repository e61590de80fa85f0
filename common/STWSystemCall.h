// Two small helpers every layer uses: retrying a system call that a signal interrupted,
// and combining hash values.
#pragma once

#include <cerrno>
#include <cstddef>

// Calls `call` until it does not fail with EINTR; answers its last result (errno is that
// of the last call).
template <class Call>
auto STWRetryOnEINTR(Call&& call) {
    for (;;) {
        auto result = call();
        if (!(result == -1 && errno == EINTR))
            return result;
    }
}

// Mixes `value` into `seed` (the boost recipe), for hashes of composite values.
inline size_t STWHashCombine(size_t seed, size_t value) {
    return seed ^ (value + 0x9e3779b97f4a7c15ULL + (seed << 6) + (seed >> 2));
}
