# widl 7.0 describes some [out] parameters whose top-level pointer the stub
# allocates ("srv size=8") by what that pointer points to, instead of by the
# FC_RP [allocated_on_stack][pointer_deref] descriptor it emits just before,
# as MIDL does and as the NDR engine expects:
#  - an [out] LPWSTR* refers to the FC_OP string pointer: the strings arrive
#    as null;
#  - an [out, string, size_is(,n)] LPWSTR** refers to the array behind the
#    FC_OP pointer: the client gets 0x800703E6, garbled strings or its own
#    memory overwritten.
# This rewrites those parameter type offsets to the FC_RP descriptor, then
# checks that every such parameter of the file now refers to a stack-allocated
# FC_RP descriptor, and fails the build when one does not.
# Usage: cmake -DFILE=x_p.c -P this
include(${CMAKE_CURRENT_LIST_DIR}/ReadWidlProxy.cmake)

# The rewrite of the parameters that refer to type offset `from`.
function(point_parameters_at from to)
  math(EXPR fromHex "${from}" OUTPUT_FORMAT HEXADECIMAL)
  math(EXPR toHex "${to}" OUTPUT_FORMAT HEXADECIMAL)
  string(REGEX REPLACE
    "(srv size=8 \\*/\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),[^\n]*\n[ \t]+)NdrFcShort\\(${fromHex}\\),\t/\\* type offset = ${from} \\*/"
    "\\1NdrFcShort(${toHex}),\t/* type offset = ${to} */" result "${text}")
  set(text "${result}" PARENT_SCOPE)
endfunction()

# Every FC_RP [allocated_on_stack][pointer_deref] descriptor: its own offset
# and its pointee's.
string(REGEX MATCHALL
  "/\\* [0-9]+ \\([^)\n]*\\) \\*/\n[ \t]+0x11, 0x14,[^\n]*\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),[^\n]*\\([0-9]+\\) \\*/"
  descriptors "${types}")
foreach(desc IN LISTS descriptors)
  string(REGEX REPLACE "^/\\* ([0-9]+) .*" "\\1" outer "${desc}")
  string(REGEX REPLACE ".*\\(([0-9]+)\\) \\*/$" "\\1" inner "${desc}")
  point_parameters_at(${inner} ${outer})
  # A pointee that is itself a unique pointer to the next entry (the array
  # of an [out, size_is(,n)] pointer).
  string(REGEX MATCH "/\\* ${inner}( \\([^)\n]*\\))? \\*/\n[ \t]+0x13, 0x0,[^\n]*\n[ \t]+NdrFcShort\\(0x2\\)," op "${types}")
  if(op)
    math(EXPR array "${inner} + 4")
    point_parameters_at(${array} ${outer})
  endif()
endforeach()

# The check: every stack-allocated out parameter now refers to an FC_RP
# descriptor with [allocated_on_stack].
string(REGEX MATCHALL
  "srv size=8 \\*/\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),[^\n]*\n[ \t]+NdrFcShort\\(0x[0-9a-f]+\\),\t/\\* type offset = [0-9]+ \\*/"
  parameters "${text}")
foreach(param IN LISTS parameters)
  string(REGEX REPLACE ".*type offset = ([0-9]+) \\*/$" "\\1" offset "${param}")
  string(REGEX MATCH "/\\* ${offset}( \\([^)\n]*\\))? \\*/\n[ \t]+0x11, 0x(14|c)," good "${types}")
  if(NOT good)
    message(FATAL_ERROR "${FILE}: an out parameter refers to type offset ${offset}, not to its top-level pointer")
  endif()
endforeach()
file(WRITE "${FILE}" "${text}")
