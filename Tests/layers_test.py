"""scripts/check-layers finds what it is for: every kind of violation, planted in a copy of the tree, one at a time."""

from __future__ import annotations

import pathlib
import shutil
import subprocess
import tempfile
import unittest

ROOT = pathlib.Path(__file__).resolve().parents[1]
PARTS = ("VeltoIDAuthentication", "Platform", "veltoidctl", "TestSupport")
NEXT_ACTION = "VeltoIDAuthentication/VeltoIDAuthenticationImpl/NextAction"
CRYPTO = "Platform/crypto/Crypto.h"

# What is included, in which file, and what is said of it.
INCLUDES = [
    ("from a header of Platform up into the engine", CRYPTO, '"VeltoIDAuthenticationImpl/NextAction.h"', ": "),
    ("from a source of Platform up into the process", "Platform/keychain/KeychainClassKeys.cpp",
     '"VeltoIDAuthd/Relaunch.h"', ": "),
    ("a folder of Platform beside", "Platform/xml/XMLReader.cpp", f'"{CRYPTO}"', ": "),
    ("a folder of Platform above", "Platform/runtime/Clock.cpp", '"Platform/storage/Preferences.h"', ": "),
    ("a relative path up", "Platform/runtime/Clock.cpp", '"../bus/Notifications.h"', ": "),
    ("the room beside", "VeltoIDAuthentication/XMLRPC/XMLRPCShim.cpp", '"IPCHelpers/IPCMessage.h"', ": "),
    ("the room above", "VeltoIDAuthentication/Logging/Log.cpp", '"XMLRPC/XMLRPCShim.h"', ": "),
    ("the engine in the client", "veltoidctl/Files.cpp", '"VeltoIDAuthenticationImpl/NextAction.h"', ": "),
    ("another's library in a room", f"{NEXT_ACTION}.cpp", "<openssl/evp.h>", " does not belong"),
    ("a library in the wrong folder of Platform", "Platform/net/HTTPSession.cpp", "<sqlite3.h>", " does not belong"),
    ("a library in a header of Platform", CRYPTO, "<openssl/evp.h>", " in a header"),
    ("a library that is not known", "Platform/net/HTTPSession.cpp", "<boost/asio.hpp>", " is neither"),
    ("the operating system in a room", f"{NEXT_ACTION}.cpp", "<fcntl.h>", " is neither"),
    ("a fake in production", f"{NEXT_ACTION}.cpp", '"TestSupport/FakeLockState.h"', " is part of the tests"),
    ("a file outside of the tree", f"{NEXT_ACTION}.cpp", '"../../../../../../../../usr/include/zlib.h"', " is not in"),
    ("a file that does not exist", f"{NEXT_ACTION}.cpp", '"Values/Nothing.h"', " is not in the tree"),
]

# Other lines, each in its file (made when it is not there), and the complaint.
LINES = [
    ("Platform/runtime/Clock.cpp", "#  include  <Platform/storage/Preferences.h>", "Platform/storage/Preferences.h: "),
    (f"{NEXT_ACTION}.cpp", "#define WHAT <cmath>\n#include WHAT", "an include that cannot be checked"),
    ("Platform/crypto/KeyPair.h", '#include "Platform/crypto/Circle.h"', "a circle: "),
    ("VeltoIDAuthentication/Attic/Attic.h", "#pragma once", "Attic is on no floor"),
    ("Platform/Attic.h", "#pragma once", "Platform/Attic.h is on no floor"),
    ("Platform/bus/Notifications.cpp", 'static const char* unit = "harbwell.service";', "Platform names the product"),
    ("Platform/crypto/CMakeLists.txt", "veltoid_room(X SOURCES x.cpp DEPENDS Logging Values)", "links Logging"),
    ("veltoidctl/CMakeLists.txt", "target_link_libraries(veltoidctl PRIVATE XMLRPC)", "links XMLRPC"),
    ("Platform/xml/Attic.hpp", "#pragma once", "neither .h nor .cpp"),
    ("layers.txt", "floor Basement", "ARCHITECTURE.md: "),
    ("ARCHITECTURE.md", "floor Basement", "ARCHITECTURE.md: "),
]


class Layers(unittest.TestCase):
    def setUp(self):
        self.tree = pathlib.Path(self.enterContext(tempfile.TemporaryDirectory(prefix="veltoid-layers-")))
        for part in PARTS:
            shutil.copytree(ROOT / part, self.tree / part)
        for file in ("layers.txt", "ARCHITECTURE.md"):
            shutil.copy(ROOT / file, self.tree)
        (self.tree / "Platform/crypto/Circle.h").write_text('#include "Platform/crypto/KeyPair.h"\n')

    def complaints(self) -> str:
        run = subprocess.run([ROOT / "scripts" / "check-layers", self.tree], capture_output=True, text=True)
        self.assertEqual(run.returncode, 1 if run.stderr else 0, run.stderr)
        return run.stderr

    def test_the_tree_is_clean_even_with_what_only_looks_like_a_violation(self):
        harmless = '// #include "VeltoIDAuthd/Relaunch.h"\n/* #include <openssl/evp.h>\n#include "x.h" */\n'
        (self.tree / "VeltoIDAuthentication/Values/Harmless.h").write_text(harmless)
        test = self.tree / "VeltoIDAuthentication/Values/Harmless_test.cpp"
        test.write_text('#include "TestSupport/FakeLockState.h"\n')
        self.assertEqual(self.complaints(), "")

    def test_each_violation_is_found(self):
        includes = [(file, f"#include {what}", what.strip('"') + complaint) for _, file, what, complaint in INCLUDES]
        for file, planted, complaint in includes + LINES:
            with self.subTest(file=file, planted=planted):
                path = self.tree / file
                before = path.read_text() if path.exists() else None
                path.parent.mkdir(exist_ok=True)
                path.write_text(f"{before or ''}\n{planted}\n")
                self.assertIn(complaint, self.complaints())
                path.unlink() if before is None else path.write_text(before)

    def test_too_many_files_in_a_folder(self):
        for number in range(40):
            (self.tree / "Platform/xml" / f"Part{number}.h").write_text("#pragma once\n")
        self.assertIn("production files", self.complaints())


if __name__ == "__main__":
    unittest.main()
