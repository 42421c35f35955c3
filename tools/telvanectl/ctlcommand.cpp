// The registry of telvanectl's commands: a list built by static constructors before wmain.
#include "tools/telvanectl/ctlcommand.h"

#include <stdio.h>
#include <string>

const CtlCommand *CtlCommand::s_pFirst = nullptr;

CtlCommand::CtlCommand(const wchar_t *wszWords, PFN_CTL_COMMAND pfnRun, const char *szUsage)
    : m_wszWords(wszWords)
    , m_pfnRun(pfnRun)
    , m_szUsage(szUsage)
    , m_pNext(s_pFirst)
{
    s_pFirst = this;
}

const CtlCommand *CtlCommand::Find(int argc, wchar_t **argv, int *pcWords)
{
    const CtlCommand *pBest = nullptr;
    int cBest = 0;
    for (const CtlCommand *p = s_pFirst; p != nullptr; p = p->m_pNext)
    {
        // Match the command's words one by one against the arguments; the longest match wins.
        std::wstring words = p->m_wszWords;
        int cWords = 0;
        size_t pos = 0;
        bool fMatch = true;
        while (pos <= words.size())
        {
            size_t end = words.find(L' ', pos);
            if (end == std::wstring::npos)
            {
                end = words.size();
            }
            if (cWords >= argc || words.compare(pos, end - pos, argv[cWords]) != 0)
            {
                fMatch = false;
                break;
            }
            cWords++;
            pos = end + 1;
        }
        if (fMatch && cWords > cBest)
        {
            pBest = p;
            cBest = cWords;
        }
    }
    *pcWords = cBest;
    return pBest;
}

void CtlCommand::PrintUsages()
{
    for (const CtlCommand *p = s_pFirst; p != nullptr; p = p->m_pNext)
    {
        fprintf(stderr, "%s", p->m_szUsage);
    }
}

int CtlCommandUsage(const char *szProblem)
{
    fprintf(stderr, "telvanectl: %s\n", szProblem);
    CtlCommand::PrintUsages();
    return c_iCtlExitUsage;
}
