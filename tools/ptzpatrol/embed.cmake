# Writes OUT, a C++ source defining `extern const char kSchemaSql[]` with the
# bytes of IN: the tool carries the schema and needs no source tree.
file(READ "${IN}" hex HEX)
string(REGEX REPLACE "(..)" "'\\\\x\\1'," bytes "${hex}")
file(WRITE "${OUT}.tmp" "// Generated from ${IN}.\nextern const char kSchemaSql[];\nconst char kSchemaSql[] = {${bytes}'\\0'};\n")
file(RENAME "${OUT}.tmp" "${OUT}")
