"""scripts/check-layers finds what it is for: every kind of violation, planted in a copy of the tree, one at a time."""

from __future__ import annotations

import pathlib
import shutil
import subprocess
import tempfile
import unittest

ROOT = pathlib.Path(__file__).resolve().parents[1]
PARTS = ("VeltoIDAuthentication", "Platform", "veltoidctl", "TestSupport")
ENGINE = "VeltoIDAuthentication/VeltoIDAuthenticationImpl"

# What is appended to which file (made when it is not there), and how the complaint begins.
PLANTED = {
    "a header of Platform looks up into the engine":
        ("Platform/crypto/Crypto.h", '#include "VeltoIDAuthenticationImpl/NextAction.h"', "VeltoIDAuthenticationImpl/NextAction.h: "),
    "a source of Platform looks up into the process":
        ("Platform/keychain/KeychainClassKeys.cpp", '#include "VeltoIDAuthd/Relaunch.h"', "VeltoIDAuthd/Relaunch.h: "),
    "a folder of Platform uses one beside it":
        ("Platform/xml/XMLReader.cpp", '#include "Platform/crypto/Crypto.h"', "Platform/crypto/Crypto.h: "),
    "a folder of Platform uses one above it, by another spelling":
        ("Platform/runtime/Clock.cpp", "#  include  <Platform/storage/Preferences.h>", "Platform/storage/Preferences.h: "),
    "a relative path leads up":
        ("Platform/runtime/Clock.cpp", '#include "../bus/Notifications.h"', "../bus/Notifications.h: "),
    "a room uses the one beside it":
        ("VeltoIDAuthentication/XMLRPC/XMLRPCShim.cpp", '#include "IPCHelpers/IPCMessage.h"', "IPCHelpers/IPCMessage.h: "),
    "a room uses the one above it":
        ("VeltoIDAuthentication/Logging/Log.cpp", '#include "XMLRPC/XMLRPCShim.h"', "XMLRPC/XMLRPCShim.h: "),
    "the client uses the engine":
        ("veltoidctl/Files.cpp", '#include "VeltoIDAuthenticationImpl/NextAction.h"', "VeltoIDAuthenticationImpl/NextAction.h: "),
    "another's library in a room":
        (f"{ENGINE}/NextAction.cpp", "#include <openssl/evp.h>", "<openssl/evp.h> does not belong"),
    "a library in the wrong folder of Platform":
        ("Platform/net/HTTPSession.cpp", "#include <sqlite3.h>", "<sqlite3.h> does not belong"),
    "a library in a header of Platform":
        ("Platform/crypto/Crypto.h", "#include <openssl/evp.h>", "<openssl/evp.h> in a header"),
    "a library that is not known":
        ("Platform/net/HTTPSession.cpp", "#include <boost/asio.hpp>", "<boost/asio.hpp> is neither"),
    "the operating system in a room":
        (f"{ENGINE}/NextAction.cpp", "#include <fcntl.h>", "<fcntl.h> is neither"),
    "a fake in production":
        (f"{ENGINE}/NextAction.cpp", '#include "TestSupport/FakeLockState.h"', "TestSupport/FakeLockState.h is part of the tests"),
    "a file that does not exist":
        (f"{ENGINE}/NextAction.cpp", '#include "Values/Nothing.h"', "Values/Nothing.h is not in the tree"),
    "an include behind a macro":
        (f"{ENGINE}/NextAction.cpp", "#define WHAT <cmath>\n#include WHAT", "an include that cannot be checked"),
    "a circle of two files":
        ("Platform/crypto/KeyPair.h", '#include "Platform/crypto/Circle.h"', "a circle: "),
    "a room that nobody has drawn":
        ("VeltoIDAuthentication/Attic/Attic.h", "#pragma once", "Attic is on no floor"),
    "a file beside the folders of Platform":
        ("Platform/Attic.h", "#pragma once", "Platform/Attic.h is on no floor"),
    "the product's name in Platform":
        ("Platform/bus/Notifications.cpp", 'static const char* unit = "harbwell.service";', "Platform names the product"),
    "a library linked upwards":
        ("Platform/crypto/CMakeLists.txt", "veltoid_room(X SOURCES x.cpp DEPENDS Logging Values)", "links Logging"),
    "another picture":
        ("layers.txt", "floor Basement", "ARCHITECTURE.md: "),
}


class Layers(unittest.TestCase):
    def setUp(self):
        self.folder = pathlib.Path(tempfile.mkdtemp(prefix="veltoid-layers-"))
        self.addCleanup(shutil.rmtree, self.folder)
        self.tree = self.folder / "tree"
        for part in PARTS:
            shutil.copytree(ROOT / part, self.tree / part)
        for file in ("layers.txt", "ARCHITECTURE.md"):
            shutil.copy(ROOT / file, self.tree)
        (self.tree / "Platform/crypto/Circle.h").write_text('#include "Platform/crypto/KeyPair.h"\n')

    def complaints(self) -> set[str]:
        run = subprocess.run([ROOT / "scripts" / "check-layers", self.tree], capture_output=True, text=True)
        self.assertEqual(run.returncode, 1 if run.stderr else 0, run.stderr)
        return set(run.stderr.splitlines())

    def test_the_tree_is_clean(self):
        self.assertEqual(self.complaints(), set())

    def test_each_violation_is_found(self):
        for kind, (file, planted, complaint) in PLANTED.items():
            with self.subTest(kind):
                path = self.tree / file
                before = path.read_text() if path.exists() else None
                path.parent.mkdir(exist_ok=True)
                path.write_text((before or "") + "\n" + planted + "\n")
                found = self.complaints()
                self.assertTrue(any(complaint in line for line in found), found)
                path.unlink() if before is None else path.write_text(before)

    def test_too_many_files_in_a_folder(self):
        for number in range(40):
            (self.tree / "Platform/xml" / f"Part{number}.h").write_text("#pragma once\n")
        self.assertTrue(any("production files" in line for line in self.complaints()))

    def test_what_only_looks_like_one_is_none(self):
        harmless = '// #include "VeltoIDAuthd/Relaunch.h"\n/* #include <openssl/evp.h>\n#include "x.h" */\n'
        (self.tree / "VeltoIDAuthentication/Values/Harmless.h").write_text(harmless)
        (self.tree / "VeltoIDAuthentication/Values/Harmless_test.cpp").write_text('#include "TestSupport/FakeLockState.h"\n')
        self.assertEqual(self.complaints(), set())


if __name__ == "__main__":
    unittest.main()
