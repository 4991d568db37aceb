import inspect
import pathlib
import pydoc
import subprocess
import sys

import pytest

import kytreporting as kyt

FOLDER = pathlib.Path(kyt.__file__).parent


def test_the_module_is_typed(tmp_path):
    pytest.importorskip("mypy")
    assert (FOLDER / "py.typed").exists()
    done = subprocess.run(
        [sys.executable, "-m", "mypy", "--strict", "--cache-dir", str(tmp_path), str(FOLDER)],
        capture_output=True,
        text=True,
        check=False,
    )
    assert done.returncode == 0, done.stdout


def test_everything_public_says_what_it_is():
    for name in kyt.__all__:
        thing = getattr(kyt, name)
        if not inspect.isclass(thing) and not inspect.isfunction(thing):
            continue
        assert inspect.getdoc(thing), name
        for member, value in vars(thing).items() if inspect.isclass(thing) else ():
            if not member.startswith("_") and (inspect.isfunction(value) or isinstance(value, property)):
                assert inspect.getdoc(value), f"{name}.{member}"


def test_pydoc_shows_the_module():
    text = pydoc.render_doc(kyt, renderer=pydoc.plaintext)
    assert "Report events to kytreportingd from Python." in text
    assert "Queues one message" in text
