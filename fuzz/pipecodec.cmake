# The pipe codec and the reassembly buffer: every message of both pipes a client can send.
telvane_add_fuzzer(pipecodec
  SOURCES ${TELVANE_ROOT}/fuzz/fuzz_pipecodec.cpp ${TELVANE_ROOT}/servicelib/pipecodec.cpp
          ${TELVANE_ROOT}/servicelib/cpipereassembly.cpp)
