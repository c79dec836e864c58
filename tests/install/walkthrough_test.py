"""What a page's blocks become."""

import pathlib
import subprocess
import tempfile
import unittest

import walkthrough

PAGE = """# A page

**src/main.cc**

```cpp
int main() {}  // it's "so"
```

Some **bold** words, and a fragment:

```cpp
nothing(at, all);
```

```sh
word='two words'
```

```sh
printf '%s\\n' "$word"
cat src/main.cc
```
"""


def run(page):
    with tempfile.TemporaryDirectory() as directory:
        environment = {"PATH": "/usr/bin:/bin", "TMPDIR": directory}
        words = ["bash", "-c", walkthrough.script(page)]
        return subprocess.run(words, cwd=directory, env=environment, capture_output=True, text=True)


class Walkthrough(unittest.TestCase):
    def test_files_are_written_and_commands_run_in_one_shell(self):
        done = run(PAGE)
        self.assertEqual((0, ""), (done.returncode, done.stderr))
        self.assertEqual('two words\nint main() {}  // it\'s "so"\n', done.stdout)

    def test_a_failing_command_ends_it_and_the_block_is_named(self):
        done = run(PAGE.replace("cat src", "false\ncat src"))
        self.assertNotEqual(0, done.returncode)
        self.assertIn("line 19", done.stderr)
        self.assertEqual("two words\n", done.stdout)

    def test_what_a_block_prints_is_compared_with_the_text_that_follows(self):
        said = PAGE + "\n```text\ntwo words\nint main() {}  // it's \"so\"\n```\n"
        self.assertEqual(0, run(said).returncode)
        self.assertNotEqual(0, run(said.replace("```text\ntwo", "```text\nthree")).returncode)
        self.assertEqual(0, run(said.replace("```text\ntwo", "Or so:\n\n```text\nthree")).returncode)

    def test_a_page_without_commands_is_refused(self):
        self.assertRaises(ValueError, walkthrough.script, PAGE.replace("```sh", "```text"))

    def test_a_file_outside_the_directory_is_refused(self):
        for name in ("/etc/passwd", "../main.cc", "src/../../main.cc"):
            self.assertRaises(ValueError, walkthrough.script, PAGE.replace("src/main.cc", name, 1))

    def test_a_block_without_an_end_is_refused(self):
        self.assertRaises(ValueError, walkthrough.script, PAGE[: PAGE.rindex("```")])


if __name__ == "__main__":
    unittest.main()
