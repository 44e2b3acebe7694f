#!/bin/bash
# The library shows exactly the names listed in exports.txt: no more, no less.
set -eu
diff -u "$2" <(nm -DC --defined-only "$1" | cut -d' ' -f3- | sed -E 's/std::__cxx11::basic_string<char, std::char_traits<char>, std::allocator<char> >/std::string/g' | LC_ALL=C sort -u)
