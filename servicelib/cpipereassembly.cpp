#include "servicelib/cpipereassembly.h"

#include <algorithm>

bool CPipeReassemblyBudget::Reserve(uint64_t cb)
{
    uint64_t cbUsed = m_cbUsed.load();
    do
    {
        if (cb > m_cbMax - cbUsed)
        {
            return false;
        }
    } while (!m_cbUsed.compare_exchange_weak(cbUsed, cbUsed + cb));
    return true;
}

void CPipeReassemblyBudget::Return(uint64_t cb)
{
    m_cbUsed.fetch_sub(cb);
}

CPipeReassemblyBudget &PipeReassemblyServiceBudget()
{
    static CPipeReassemblyBudget s_budget(TELVANE_MAX_PENDING_ITEMS);
    return s_budget;
}

CPipeReassembly::CPipeReassembly(size_t cbMax, CPipeReassemblyBudget *pBudget)
    : m_cbMax(cbMax)
    , m_pBudget(pBudget)
{
}

CPipeReassembly::~CPipeReassembly()
{
    ReturnBudget();
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
        if (m_pBudget != nullptr && !m_pBudget->Reserve(cb))
        {
            Clear();
            return PipePartOverBudget;
        }
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
    ReturnBudget();
    std::vector<uint8_t> vb;
    vb.swap(m_vbBuffer);
    return vb;
}

void CPipeReassembly::Clear()
{
    ReturnBudget();
    // Frees the storage too: an idle connection should not keep a large item's memory.
    std::vector<uint8_t>().swap(m_vbBuffer);
}

void CPipeReassembly::ReturnBudget()
{
    if (m_pBudget != nullptr && !m_vbBuffer.empty())
    {
        m_pBudget->Return(m_vbBuffer.size());
    }
}
