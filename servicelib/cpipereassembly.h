// The per-connection buffer in which the parts of one event (activity pipe) or one result
// (collector pipe) are joined. Owned by its endpoint and used only inside the endpoint's
// handlers, so it takes no lock. The cap bounds what one client can make the service hold.
// Platform-free, like the codec it serves.
#pragma once

#include "inc/telvanepipe.h"

#include <cstddef>
#include <cstdint>
#include <vector>

constexpr size_t c_cbPipeReassemblyMax = TELVANE_MAX_ITEM;

enum PIPE_PART_RESULT
{
    PipePartMore,     // appended; more parts of this item follow
    PipePartComplete, // appended; the item is complete and waits in the buffer
    PipePartTooLarge, // the item would exceed the cap: the buffer was emptied, close the pipe
};

class CPipeReassembly
{
public:
    explicit CPipeReassembly(size_t cbMax = c_cbPipeReassemblyMax);

    CPipeReassembly(const CPipeReassembly &) = delete;
    CPipeReassembly &operator=(const CPipeReassembly &) = delete;

    // Appends one accepted part's payload (cb may be 0).
    PIPE_PART_RESULT AddPart(const uint8_t *pb, size_t cb, bool fComplete);

    // The joined bytes; null when the buffer is empty.
    const uint8_t *Data() const { return m_vbBuffer.empty() ? nullptr : m_vbBuffer.data(); }
    size_t Size() const { return m_vbBuffer.size(); }

    // Hands the joined bytes on without copying them and leaves the buffer empty.
    std::vector<uint8_t> Take();
    void Clear();

private:
    size_t m_cbMax;
    std::vector<uint8_t> m_vbBuffer;
};
