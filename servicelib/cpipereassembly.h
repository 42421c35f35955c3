// The per-connection buffer in which the parts of one event (activity pipe) or one result
// (collector pipe) are joined. Owned by its endpoint and used only inside the endpoint's
// handlers, so it takes no lock. The cap bounds what one client can make the service hold;
// an optional budget, shared by every connection, bounds what all of them hold together.
// Platform-free, like the codec it serves.
#pragma once

#include "inc/telvanepipe.h"

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <vector>

constexpr size_t c_cbPipeReassemblyMax = TELVANE_MAX_ITEM;

// Bytes held in unfinished items across connections. Any thread may reserve and return
// without a lock.
class CPipeReassemblyBudget
{
public:
    explicit CPipeReassemblyBudget(uint64_t cbMax)
        : m_cbMax(cbMax)
        , m_cbUsed(0)
    {
    }

    CPipeReassemblyBudget(const CPipeReassemblyBudget &) = delete;
    CPipeReassemblyBudget &operator=(const CPipeReassemblyBudget &) = delete;

    // False, with nothing reserved, when cb would take the total past the maximum.
    bool Reserve(uint64_t cb);
    void Return(uint64_t cb);
    uint64_t Used() const { return m_cbUsed.load(); }

private:
    const uint64_t m_cbMax;
    std::atomic<uint64_t> m_cbUsed;
};

// The budget every endpoint of the service draws on.
CPipeReassemblyBudget &PipeReassemblyServiceBudget();

enum PIPE_PART_RESULT
{
    PipePartMore,       // appended; more parts of this item follow
    PipePartComplete,   // appended; the item is complete and waits in the buffer
    PipePartTooLarge,   // the item would exceed the cap: the buffer was emptied, close the pipe
    PipePartOverBudget, // all connections together would exceed the budget: emptied, close
};

class CPipeReassembly
{
public:
    explicit CPipeReassembly(size_t cbMax = c_cbPipeReassemblyMax,
                             CPipeReassemblyBudget *pBudget = nullptr);
    ~CPipeReassembly();

    CPipeReassembly(const CPipeReassembly &) = delete;
    CPipeReassembly &operator=(const CPipeReassembly &) = delete;

    // Appends one accepted part's payload (cb may be 0).
    PIPE_PART_RESULT AddPart(const uint8_t *pb, size_t cb, bool fComplete);

    // The joined bytes; null when the buffer is empty.
    const uint8_t *Data() const { return m_vbBuffer.empty() ? nullptr : m_vbBuffer.data(); }
    size_t Size() const { return m_vbBuffer.size(); }

    // Hands the joined bytes on without copying them and leaves the buffer empty; the bytes
    // no longer count against the budget.
    std::vector<uint8_t> Take();
    void Clear();

private:
    void ReturnBudget();

    size_t m_cbMax;
    CPipeReassemblyBudget *m_pBudget;
    std::vector<uint8_t> m_vbBuffer;
};
