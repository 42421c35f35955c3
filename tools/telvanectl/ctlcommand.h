// The commands of telvanectl beyond the two clients. Each area (traces, each stand-in under
// "platform") lives in a file of its own and registers itself with one static CtlCommand, so
// adding a command touches no other file. Runs on telvanectl's main thread only.
#pragma once

#include <windows.h>

// Exit codes shared by every command.
const int c_iCtlExitOk = 0;
const int c_iCtlExitFailed = 1;
const int c_iCtlExitUsage = 2;

// argv[0] is the first word after the command's own words: for "telvanectl platform
// device set X Y", the command "platform device" gets {"set", "X", "Y"}.
typedef int (*PFN_CTL_COMMAND)(int argc, wchar_t **argv);

class CtlCommand
{
public:
    // wszWords: "trace" or "platform device"; szUsage: the lines the usage text shows,
    // each starting with "telvanectl ".
    CtlCommand(const wchar_t *wszWords, PFN_CTL_COMMAND pfnRun, const char *szUsage);

    // The registered command whose words start argv, or null; *pcWords is how many words
    // of argv it took.
    static const CtlCommand *Find(int argc, wchar_t **argv, int *pcWords);
    static void PrintUsages();

    int Run(int argc, wchar_t **argv) const { return m_pfnRun(argc, argv); }

private:
    const wchar_t *m_wszWords;
    PFN_CTL_COMMAND m_pfnRun;
    const char *m_szUsage;
    const CtlCommand *m_pNext;
    static const CtlCommand *s_pFirst;
};

// Prints "telvanectl: <szProblem>" and the usage of every command; returns c_iCtlExitUsage.
int CtlCommandUsage(const char *szProblem);
