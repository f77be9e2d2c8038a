#!/bin/sh
# A test program that is started without the sandbox refuses to run. No test is selected, so that nothing
# would happen if it did run. Argument: the test program.
"$1" --gtest_filter=None.*
code=$?
[ "$code" -eq 99 ] || { echo "exit code $code instead of 99"; exit 1; }
