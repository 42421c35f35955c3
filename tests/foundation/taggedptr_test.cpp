#include "inc/ctaggedptr.h"
#include "servicelib/diagnostics.h"
#include "tests/common/testsupport.h"

#include <gtest/gtest.h>

using testsupport::FailureCapture;

namespace
{
// A tagged-counted object that records how it died; each test owns its objects on its main
// thread.
class CCounted
{
public:
    explicit CCounted(bool *pfDeleted, CTaggedPtr<CCounted, 6> *pHolder = nullptr)
        : m_pfDeleted(pfDeleted)
        , m_pHolder(pHolder)
    {
    }
    ~CCounted()
    {
        *m_pfDeleted = true;
        for (unsigned long i = 0; i < c_cServiceTags; i++)
        {
            EXPECT_EQ(0, m_refs.TagCount(i)) << "tag " << i;
        }
        if (m_pHolder != nullptr)
        {
            EXPECT_EQ(nullptr, m_pHolder->Get()) << "holder not emptied before the release";
        }
    }
    ULONG AddRef(ULONG ulTag) { return m_refs.AddRef(ulTag); }
    ULONG Release(ULONG ulTag)
    {
        ULONG cRef = m_refs.Release(ulTag, L"CCounted::Release", TELVANE_WFILE, __LINE__);
        if (cRef == 0)
        {
            delete this;
        }
        return cRef;
    }
    long TagCount(ULONG ulTag) const { return m_refs.TagCount(ulTag); }
    long Total() const { return m_refs.Total(); }

private:
    TaggedRefCount<c_cServiceTags> m_refs;
    bool *m_pfDeleted;
    CTaggedPtr<CCounted, 6> *m_pHolder;
};
} // namespace

TAGGED_PTR_CLASS_NAME(CCounted);

TEST(TaggedRefCount, LastReleaseOfAnyTagDeletesReleaseUnderAnUnusedTagIsFatal)
{
    bool fDeleted = false;
    CCounted *p = new CCounted(&fDeleted);
    EXPECT_EQ(1, p->Total());
    EXPECT_EQ(1, p->TagCount(0));
    EXPECT_EQ(2u, p->AddRef(30));
    EXPECT_EQ(3u, p->AddRef(30));
    EXPECT_EQ(2u, p->Release(0)); // the creator lets go first
    EXPECT_FALSE(fDeleted);
    EXPECT_EQ(1u, p->Release(30));
    EXPECT_EQ(0u, p->Release(30));
    EXPECT_TRUE(fDeleted);

    FailureCapture failures;
    fDeleted = false;
    p = new CCounted(&fDeleted);
    p->AddRef(4);
    p->Release(5); // wrong holder: reported, and (as under a debugger) the total still falls
    ASSERT_EQ(1u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"CCounted::Release: Fatal error"));
    EXPECT_TRUE(failures.Contains(L"from Release"));
    EXPECT_EQ(1, p->Total());
    EXPECT_EQ(-1, p->TagCount(5));
    // Balance the books so the object can go.
    p->AddRef(5);
    p->Release(4);
    EXPECT_FALSE(fDeleted);
    p->Release(0);
    EXPECT_TRUE(fDeleted);
}

TEST(CTaggedPtr, AssignmentRules)
{
    FailureCapture failures;
    bool fFirstDeleted = false;
    bool fSecondDeleted = false;
    CTaggedPtr<CCounted, 6> holder;
    CCounted *pFirst = new CCounted(&fFirstDeleted, &holder);
    CCounted *pSecond = new CCounted(&fSecondDeleted);

    holder = pFirst;
    EXPECT_EQ(1, pFirst->TagCount(6));
    holder = pFirst; // the same object again changes nothing
    EXPECT_EQ(1, pFirst->TagCount(6));
    EXPECT_EQ(2, pFirst->Total());
    EXPECT_EQ(0u, failures.Count());

    pFirst->Release(0); // the creator's reference; the holder keeps it alive
    EXPECT_FALSE(fFirstDeleted);

    // Another object without Release() first is a fatal error naming class and tag.
    holder = pSecond;
    ASSERT_EQ(1u, failures.Count());
    EXPECT_TRUE(failures.Contains(L"CTaggedPtr<class CCounted,6>::operator =: Fatal error"))
        << testsupport::Narrow(failures.Lines()[0]);
    EXPECT_TRUE(failures.Contains(L"from Release() first"));
    EXPECT_EQ(pSecond, holder.Get());
    // As under a debugger, the old reference was never released: put it back to clean up.
    CCounted *pLeaked = pFirst;
    holder.Release();
    EXPECT_FALSE(fSecondDeleted);
    pSecond->Release(0);
    EXPECT_TRUE(fSecondDeleted);

    // Emptying is done with Release(); assigning null to a full pointer is the same fault.
    holder = pLeaked;
    pLeaked->Release(6); // drop the leaked tag-6 reference from the first assignment
    size_t cBefore = failures.Count();
    holder = nullptr;
    EXPECT_EQ(cBefore + 1, failures.Count());
    EXPECT_EQ(nullptr, holder.Get());
    EXPECT_FALSE(fFirstDeleted); // its last reference is still the leaked one
    pLeaked->Release(6);
    EXPECT_TRUE(fFirstDeleted);
}

TEST(CTaggedPtr, ReleaseEmptiesBeforeTheObjectGoesAndDestructorReleases)
{
    bool fDeleted = false;
    {
        CTaggedPtr<CCounted, 6> holder;
        CCounted *p = new CCounted(&fDeleted, &holder);
        holder = p;
        p->Release(0);
        holder.Release(); // the destructor of CCounted checks the field is already null
        EXPECT_TRUE(fDeleted);
        holder.Release(); // empty: nothing happens
    }
    bool fDeletedByScope = false;
    {
        CTaggedPtr<CCounted, 6> holder;
        CCounted *p = new CCounted(&fDeletedByScope);
        holder = p;
        p->Release(0);
    }
    EXPECT_TRUE(fDeletedByScope);
}
