// What the whole platform component DLL shares: its module handle and the counts that
// decide DllCanUnloadNow. Any thread.
#pragma once

#include <windows.h>

HMODULE ComponentModuleHandle();
void ComponentModuleSetHandle(HMODULE hModule);

// Live objects of the class; each keeps the DLL loaded.
ULONG ComponentModuleObjectCount();
void ComponentModuleAddObject();
void ComponentModuleRemoveObject();

// Locks taken through IClassFactory::LockServer.
void ComponentModuleLock(BOOL fLock);

// True when no object lives and no lock is held.
bool ComponentModuleCanUnload();
