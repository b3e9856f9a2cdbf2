# Turns every file under WEB_DIR into bytes in the generated C++ source OUTPUT, each with its
# path (relative to WEB_DIR) and the first 16 hex digits of its SHA-256, plus one hash over the
# whole tree (which names the immutable asset URLs). Run with cmake -P.
cmake_minimum_required(VERSION 3.20)
file(GLOB_RECURSE _files LIST_DIRECTORIES false RELATIVE ${WEB_DIR} ${WEB_DIR}/*)
list(SORT _files)
set(_entries "")
set(_arrays "")
set(_tree "")
set(_index 0)
foreach(_rel IN LISTS _files)
  if(_rel MATCHES "(^|/)\\.")
    continue()
  endif()
  file(SHA256 ${WEB_DIR}/${_rel} _sha)
  string(SUBSTRING ${_sha} 0 16 _hash)
  file(READ ${WEB_DIR}/${_rel} _hex HEX)
  file(SIZE ${WEB_DIR}/${_rel} _size)
  string(REGEX REPLACE "([0-9a-f][0-9a-f])" "0x\\1," _bytes "${_hex}")
  string(APPEND _arrays "const unsigned char kFile${_index}[] = {${_bytes}0};\n")
  string(APPEND _entries "    {\"${_rel}\", kFile${_index}, ${_size}, \"${_hash}\"},\n")
  string(APPEND _tree "${_rel}:${_hash}\n")
  math(EXPR _index "${_index} + 1")
endforeach()
string(SHA256 _treeSha "${_tree}")
string(SUBSTRING ${_treeSha} 0 16 _treeHash)
file(WRITE ${OUTPUT}.tmp "// Generated from web/ at build time; do not edit.
#include \"server/EmbeddedWeb.h\"

namespace tamber {
namespace {
${_arrays}
const EmbeddedWebFile kFiles[] = {
${_entries}    {nullptr, nullptr, 0, nullptr},
};
}  // namespace

std::span<const EmbeddedWebFile> EmbeddedWeb::files() {
    return {kFiles, ${_index}};
}

const char* EmbeddedWeb::treeHash() {
    return \"${_treeHash}\";
}

}  // namespace tamber
")
# Only a changed source touches the output, so an unchanged tree rebuilds nothing.
file(COPY_FILE ${OUTPUT}.tmp ${OUTPUT} ONLY_IF_DIFFERENT)
file(REMOVE ${OUTPUT}.tmp)
