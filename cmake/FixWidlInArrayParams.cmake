# widl describes an [in, size_is(n)] parameter that points to an array of
# complex elements (structures with pointers, VARIANTs) as a simple reference
# to the array, as MIDL does. The array cannot be used in place in the
# received buffer, so the stub allocates it; Wine's interpreted stub then
# frees what the elements point to but never the array itself: every
# AddItems, ValidateItems and Write leaked its array in the server (48 bytes
# an item for AddItems), and every OnDataChange and OnReadComplete its VARIANT
# array in the client.
# This makes each such parameter refer to the FC_RP descriptor widl emits for
# the same array, without the simple-reference flag: the stub then unmarshals
# and frees it as the pointer it is, array included (on Windows as well).
# It fails the build when such a parameter has no FC_RP descriptor to refer to.
# Usage: cmake -DFILE=x_p.c -P this
include(${CMAKE_CURRENT_LIST_DIR}/ReadWidlProxy.cmake)

# [in] simple references: "must free, in, simple ref", with or without
# "must size".
string(REGEX MATCHALL
  "NdrFcShort\\(0x10[ab]\\),\t/\\* flags: [^\n]*must free, in, simple ref \\*/\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),[^\n]*\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),\t/\\* type offset = [0-9]+ \\*/"
  parameters "${text}")
list(REMOVE_DUPLICATES parameters)
foreach(param IN LISTS parameters)
  string(REGEX REPLACE ".*type offset = ([0-9]+) \\*/$" "\\1" offset "${param}")
  # Only complex arrays (FC_BOGUS_ARRAY): the others are used in place.
  string(REGEX MATCH "/\\* ${offset}( \\([^)\n]*\\))? \\*/\n[ \t]+0x21," complex "${types}")
  if(NOT complex)
    continue()
  endif()
  string(REGEX MATCH
    "/\\* [0-9]+( \\([^)\n]*\\))? \\*/\n[ \t]+0x11, 0x0,\t/\\* FC_RP \\*/\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),\t/\\* Offset= -?[0-9]+ \\(${offset}\\) \\*/"
    descriptor "${types}")
  if(NOT descriptor)
    message(FATAL_ERROR "${FILE}: no FC_RP descriptor for the [in] array at type offset ${offset}")
  endif()
  string(REGEX REPLACE "^/\\* ([0-9]+).*" "\\1" pointer "${descriptor}")
  math(EXPR pointerHex "${pointer}" OUTPUT_FORMAT HEXADECIMAL)
  string(REGEX REPLACE "^NdrFcShort\\(0x10([ab])\\),\t/\\* flags: ([^\n]*), simple ref \\*/" "NdrFcShort(0x\\1),\t/* flags: \\2 */"
    fixed "${param}")
  string(REGEX REPLACE "NdrFcShort\\(0x[0-9a-f]+\\),\t/\\* type offset = [0-9]+ \\*/$"
    "NdrFcShort(${pointerHex}),\t/* type offset = ${pointer} */" fixed "${fixed}")
  string(REPLACE "${param}" "${fixed}" text "${text}")
endforeach()
file(WRITE "${FILE}" "${text}")
