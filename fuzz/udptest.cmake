# The UDP test's platform-free pieces: the ISO duration parser, and the argument text built
# from a policy record together with the relay-name rule that keeps it one token.
telvane_add_fuzzer(isoduration
  SOURCES ${TELVANE_ROOT}/fuzz/udptest/fuzz_isoduration.cpp ${TELVANE_ROOT}/service/isoduration.cpp)
telvane_add_fuzzer(udpcommandline
  SOURCES ${TELVANE_ROOT}/fuzz/udptest/fuzz_udpcommandline.cpp
          ${TELVANE_ROOT}/service/udptestcommandline.cpp ${TELVANE_ROOT}/service/udptestconfig.cpp)
