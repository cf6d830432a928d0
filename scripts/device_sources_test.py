#!/usr/bin/env python3
"""Checks device_sources.py on Android.bp files of its own making."""

import os
import sys
import tempfile
import unittest

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from device_sources import BlueprintError, device_sources  # noqa: E402

TREE = ['a/one.cpp', 'a/two.cpp', 'a/skip.cpp', 'a/deep/three.cpp', 'b/four.cpp', 'b/note.txt', 'c/dev.cpp',
        'c/host_side.cpp', 'd/unlinked.cpp', 'host/a/stand_in.cpp', 'main.cpp']

BLUEPRINT = '''
// Variables, comments, defaults, a chain of libraries and target parts, as Soong reads them.
common_srcs = ["b/*.cpp"]
cc_defaults { name: "defs", srcs: common_srcs, /* inline */ cflags: ["-Wall"] }
cc_library_static {
    name: "liba",
    srcs: ["a/**/*.cpp"],
    exclude_srcs: ["a/skip.cpp"],
    static_libs: ["libc_part", "libexternal"],
}
cc_library_static {
    name: "libc_part",
    defaults: ["defs"],
    target: { android: { srcs: ["c/dev.cpp"] }, host: { srcs: ["c/host_side.cpp"] } },
}
cc_library_static { name: "libunlinked", srcs: ["d/*.cpp"] }
cc_binary { name: "prog", srcs: ["main.cpp"], whole_static_libs: ["liba"], enabled: true, n: -1 }
'''


class DeviceSourcesTest(unittest.TestCase):
    def setUp(self):
        self.dir = tempfile.TemporaryDirectory()
        for path in TREE:
            os.makedirs(os.path.join(self.dir.name, os.path.dirname(path)), exist_ok=True)
            open(os.path.join(self.dir.name, path), 'w').close()

    def tearDown(self):
        self.dir.cleanup()

    def sources(self, blueprint, binary='prog'):
        path = os.path.join(self.dir.name, 'Android.bp')
        with open(path, 'w') as bp:
            bp.write(blueprint)
        return device_sources(path, binary)

    def test_follows_links_defaults_and_device_parts_only(self):
        self.assertEqual(self.sources(BLUEPRINT),
                         ['a/deep/three.cpp', 'a/one.cpp', 'a/two.cpp', 'b/four.cpp', 'c/dev.cpp', 'main.cpp'])

    def test_refuses_what_cannot_be_checked_honestly(self):
        broken = {
            'host-only': BLUEPRINT.replace('"c/dev.cpp"', '"host/**/*.cpp"'),
            'does not exist': BLUEPRINT.replace('"main.cpp"', '"gone.cpp"'),
            'cannot compile': BLUEPRINT.replace('"b/*.cpp"', '"b/*"'),
            'no cc_binary': BLUEPRINT.replace('"prog"', '"other"'),
            "expected ,": BLUEPRINT.replace('name: "liba",', 'name: "liba"'),
            'unknown value': BLUEPRINT.replace('common_srcs = ', 'other = '),
        }
        for reason, blueprint in broken.items():
            with self.subTest(reason), self.assertRaisesRegex(BlueprintError, reason):
                self.sources(blueprint)


if __name__ == '__main__':
    unittest.main()
