// Reference counts kept per holder tag, so that a release by the wrong holder, or a second
// release, is caught where it happens. Platform-free: the JSON text code that includes it
// also builds natively for fuzzing.
#pragma once

#include <atomic>

// Reports a broken reference-count invariant. In the service this is a fatal error with the
// thread's last error as the code; native builds of the parsers supply their own.
void TaggedRefFailure(const wchar_t *wszFunction, const wchar_t *wszFile, unsigned long ulLine,
                      const wchar_t *wszCall);

// Member of every tagged-counted class; any thread may add and release without a lock.
// A new count holds the creator's reference under tag 0.
template <unsigned long CTags>
class TaggedRefCount
{
public:
    TaggedRefCount()
        : m_cTotal(1)
    {
        for (unsigned long i = 0; i < CTags; i++)
        {
            m_rgcTag[i].store(0);
        }
        m_rgcTag[0].store(1);
    }

    TaggedRefCount(const TaggedRefCount &) = delete;
    TaggedRefCount &operator=(const TaggedRefCount &) = delete;

    // Returns the new total.
    unsigned long AddRef(unsigned long ulTag)
    {
        m_rgcTag[ulTag].fetch_add(1);
        return static_cast<unsigned long>(m_cTotal.fetch_add(1) + 1);
    }

    // Returns the new total; the owner deletes itself when it reaches 0. A release under a
    // tag that holds nothing is reported from wszReleaseFunction (the class's Release); if
    // the report returns (a debugger), the total still falls.
    unsigned long Release(unsigned long ulTag, const wchar_t *wszReleaseFunction,
                          const wchar_t *wszFile, unsigned long ulLine)
    {
        if (m_rgcTag[ulTag].fetch_sub(1) - 1 < 0)
        {
            TaggedRefFailure(wszReleaseFunction, wszFile, ulLine, L"Release");
        }
        return static_cast<unsigned long>(m_cTotal.fetch_sub(1) - 1);
    }

    long TagCount(unsigned long ulTag) const { return m_rgcTag[ulTag].load(); }
    long Total() const { return m_cTotal.load(); }

private:
    std::atomic<long> m_cTotal;
    std::atomic<long> m_rgcTag[CTags];
};

// Tag counts of the service classes and of the JSON classes.
const unsigned long c_cServiceTags = 31;
const unsigned long c_cJsonTags = 6;
