# Turns text files into a C++ source that defines one constant.
#
#   cmake -DINPUTS=a;b -DOUTPUT=x.cpp -DHEADER=folder/x.h -DVARIABLE=kText -P EmbedText.cmake
#
# The bytes are written as a character array: compilers bound the length of string literals, and a
# text may hold any delimiter a raw literal could choose.
set(bytes "")
foreach(input IN LISTS INPUTS)
  file(READ "${input}" hex HEX)
  string(APPEND bytes "${hex}")
endforeach()
string(REGEX REPLACE "([0-9a-f][0-9a-f])" "'\\\\x\\1'," bytes "${bytes}")
string(REGEX REPLACE "('.x0a',)" "\\1\n" bytes "${bytes}")
file(WRITE "${OUTPUT}.new" "// Made by cmake/EmbedText.cmake; do not edit.
#include \"${HEADER}\"

namespace {
constexpr char kBytes[] = {
${bytes}'\\0'};
}  // namespace

namespace orv {
extern const char* const ${VARIABLE};
const char* const ${VARIABLE} = kBytes;
}  // namespace orv
")
file(COPY_FILE "${OUTPUT}.new" "${OUTPUT}" ONLY_IF_DIFFERENT)
file(REMOVE "${OUTPUT}.new")
file(TOUCH "${OUTPUT}")
