#!/usr/bin/env python3
"""The room check accepts a tidy tree and refuses each planted violation, naming rule and line.

Usage: check_rooms_test.py CHECK_ROOMS
"""
import os
import subprocess
import sys
import tempfile
import unittest

CHECK = ""

TIDY = {
    "CMakeLists.txt": "add_subdirectory(provider)\n",
    "platform/foundation/CMakeLists.txt": "yomber_room(foundation SOURCES error.cpp TESTS error_test.cpp)\n",
    "platform/foundation/error.h": "#pragma once\n#include <string>\n",
    "platform/foundation/error.cpp":
        '#include "platform/foundation/error.h"\n\n#include <spdlog/spdlog.h>\n',
    "platform/foundation/error_test.cpp": '#include "platform/foundation/error.h"\n',
    "platform/ipc/loop.h": "#pragma once\n#include <kj/async.h>\n",
    "platform/ostrell/wire.h": '#pragma once\n#include "platform/foundation/error.h"\n',
    "provider/CMakeLists.txt": "yomber_room(provider SOURCES extension/lookup.cpp)\n",
    "provider/extension/lookup.cpp": '#include "platform/foundation/error.h"\n#include <map>\n',
    "zarn/CMakeLists.txt": "yomber_room(zarn SOURCES writer.cpp)\n",
    "zarn/plain.h": "#pragma once\n",
    "zarn/writer.h": '#pragma once\n#include "platform/ipc/loop.h"\n',
    "zarn/writer.cpp": '#include "zarn/writer.h"\n\n#include <sqlite3.h>\n',
}


def check(files):
    with tempfile.TemporaryDirectory() as root:
        for path, text in files.items():
            os.makedirs(os.path.dirname(os.path.join(root, path)), exist_ok=True)
            with open(os.path.join(root, path), "w", encoding="utf-8") as file:
                file.write(text)
        return subprocess.run([CHECK, root], text=True, capture_output=True, check=False)


class CheckRooms(unittest.TestCase):
    def refuses(self, expected, path, text):
        done = check({**TIDY, path: text})
        self.assertEqual(done.returncode, 1, done.stdout + done.stderr)
        self.assertIn(expected, done.stdout)
        self.assertIn(" 1 violations", done.stdout)

    def adds(self, expected, path, text):
        self.refuses(expected, path, TIDY[path] + text)

    def test_accepts_a_tidy_tree(self):
        done = check(TIDY)
        self.assertEqual(done.returncode, 0, done.stdout + done.stderr)

    def test_refuses_an_empty_tree(self):
        self.assertEqual(check({"README.md": "\n"}).returncode, 2)

    def test_upward_include(self):
        self.adds('error.h:3: room: platform/foundation may not include "zarn/plain.h"',
                  "platform/foundation/error.h", '#include "zarn/plain.h"\n')

    def test_program_into_program(self):
        self.refuses("fileproviderd/host.h:2: room: ", "fileproviderd/host.h",
                     '#pragma once\n#include "zarn/writer.h"\n')

    def test_provider_and_library(self):
        done = check({**TIDY, "provider/extension/lookup.cpp": "#include <capnp/message.h>\n"})
        self.assertEqual(done.returncode, 1)
        self.assertIn("lookup.cpp:1: room: provider may not include <capnp/message.h>", done.stdout)

    def test_provider_and_program(self):
        self.adds('lookup.cpp:3: room: provider may not include "zarn/plain.h"',
                  "provider/extension/lookup.cpp", '#include "zarn/plain.h"\n')

    def test_provider_sees_a_library_through_others(self):
        done = check({**TIDY,
                      "platform/ostrell/wire.h": '#pragma once\n#include "platform/ipc/loop.h"\n',
                      "provider/extension/lookup.cpp": '#include "platform/ostrell/wire.h"\n'})
        self.assertEqual(done.returncode, 1)
        self.assertIn("loop.h:2: provider sees a library: kj/async.h, by way of platform/ipc/loop.h "
                      "<- platform/ostrell/wire.h <- provider/extension/lookup.cpp", done.stdout)

    def test_library_in_a_platform_header(self):
        self.adds("wire.h:3: library in a platform header", "platform/ostrell/wire.h",
                  "#include <sqlite3.h>\n")

    def test_include_path_not_from_the_root(self):
        self.adds('error_test.cpp:2: include path: "fake.h"', "platform/foundation/error_test.cpp",
                  '#include "fake.h"\n')

    def test_test_that_is_not_built(self):
        self.refuses("zarn/lost_test.cpp:1: not built", "zarn/lost_test.cpp", "int x;\n")

    def test_name_that_only_contains_the_name(self):
        self.refuses("platform/foundation/test.cpp:1: not built", "platform/foundation/test.cpp",
                     "int x;\n")

    def test_room_without_rules(self):
        self.refuses("attic/box.h:1: no room", "attic/box.h", "#pragma once\n")

    def test_own_header_not_first(self):
        self.refuses("writer.cpp:1: own header first", "zarn/writer.cpp",
                     '#include <string>\n#include "zarn/writer.h"\n')

    def test_header_without_guard(self):
        self.refuses("zarn/bare.h:1: header", "zarn/bare.h", "int x();\n")

    def test_file_name(self):
        self.refuses("zarn/WriterKind.h:1: file name", "zarn/WriterKind.h", "#pragma once\n")

    def test_unfinished(self):
        self.adds("writer.h:3: unfinished", "zarn/writer.h", "// TO" + "DO: write\n")

    def test_source_of_a_rule(self):
        self.adds("writer.h:3: source of a rule", "zarn/writer.h", "// see Pa" + "rt 1.2\n")

    def test_path_of_one_machine(self):
        self.refuses("README.md:1: path of one machine", "README.md", "cd /wo" + "rk/main\n")

    def test_sleep_in_a_test(self):
        self.adds("error_test.cpp:2: sleep in a test", "platform/foundation/error_test.cpp",
                  "std::this_thread::sleep_" + "for(1s);\n")

    def test_sleep_in_a_test_script(self):
        self.refuses("tests/wait.sh:2: sleep in a test", "tests/wait.sh", "#!/bin/bash\nslee" + "p 1\n")

    def test_skip_without_a_reason(self):
        self.adds("error_test.cpp:2: silent skip", "platform/foundation/error_test.cpp",
                  "GTEST_SK" + "IP();\n")

    def test_disabled_test(self):
        self.adds("error_test.cpp:2: silent skip", "platform/foundation/error_test.cpp",
                  "TEST(Error, DISAB" + "LED_Prints) {}\n")

    def test_nolint_without_a_reason(self):
        self.adds("writer.h:3: silent NOLINT", "zarn/writer.h", "int x;  // NO" + "LINT(foo)\n")

    def test_long_file(self):
        self.adds("writer.h:601: length", "zarn/writer.h", "\n" * 600)


if __name__ == "__main__":
    if len(sys.argv) < 2:
        sys.exit(__doc__)
    CHECK = os.path.realpath(sys.argv.pop(1))
    unittest.main()
