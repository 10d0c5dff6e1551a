# Sourced by check_exports.sh and check_dll_exports.sh.
#
# only_class_members NAMES WHAT: fails (exit 1) unless every line of NAMES (demangled exported
# names) is a member of KovPager, KovBtree or KovBtreeCursor and each of the three exports one;
# WHAT is how the messages call the names ("symbols", "names").
only_class_members() {
    stray=$(printf '%s\n' "$1" | grep -v -E '^(KovPager|KovBtree|KovBtreeCursor)::' || true)
    classes=$(printf '%s\n' "$1" | grep -c -E '^(KovPager|KovBtree|KovBtreeCursor)::' || true)
    if [ -n "$stray" ]; then
        echo "$2 exported outside the three classes:" >&2
        printf '%s\n' "$stray" >&2
        exit 1
    fi
    for class in KovPager KovBtree KovBtreeCursor; do
        printf '%s\n' "$1" | grep -q -E "^$class::" || { echo "$class exports nothing" >&2; exit 1; }
    done
    echo "$classes $2 exported, all members of the three classes"
}
