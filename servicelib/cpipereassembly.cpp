#include "servicelib/cpipereassembly.h"

#include <algorithm>

CPipeReassembly::CPipeReassembly(size_t cbMax)
    : m_cbMax(cbMax)
{
}

PIPE_PART_RESULT CPipeReassembly::AddPart(const uint8_t *pb, size_t cb, bool fComplete)
{
    size_t cbHeld = m_vbBuffer.size();
    if (cb > m_cbMax - cbHeld)
    {
        // The connection is about to close: give the memory back now, not at the endpoint's
        // destruction.
        Clear();
        return PipePartTooLarge;
    }
    if (cb != 0)
    {
        // Grow geometrically, but never past the cap: a large item must not cost twice the cap.
        size_t cbNeeded = cbHeld + cb;
        if (cbNeeded > m_vbBuffer.capacity())
        {
            m_vbBuffer.reserve(std::min(std::max(cbNeeded, 2 * m_vbBuffer.capacity()), m_cbMax));
        }
        m_vbBuffer.insert(m_vbBuffer.end(), pb, pb + cb);
    }
    return fComplete ? PipePartComplete : PipePartMore;
}

std::vector<uint8_t> CPipeReassembly::Take()
{
    std::vector<uint8_t> vb;
    vb.swap(m_vbBuffer);
    return vb;
}

void CPipeReassembly::Clear()
{
    // Frees the storage too: an idle connection should not keep a large item's memory.
    std::vector<uint8_t>().swap(m_vbBuffer);
}
