"""Builds the module with the project's CMake and puts it, its type stubs and
libnxbase (in nxbase.libs/, found through the module's run path) into the
wheel. See pyproject.toml for the offline install."""
import os
import pathlib
import shutil
import subprocess
import sys

from setuptools import Extension, setup
from setuptools.command.build_ext import build_ext

ROOT = pathlib.Path(__file__).resolve().parent


class CMakeBuild(build_ext):
    def build_extension(self, ext):
        target = pathlib.Path(self.get_ext_fullpath(ext.name)).resolve().parent
        build = pathlib.Path(self.build_temp).resolve() / "cmake"
        stage = build / "stage"
        options = ["-DCMAKE_BUILD_TYPE=Release", f"-DCMAKE_INSTALL_PREFIX={stage}",
                   f"-DPython_EXECUTABLE={sys.executable}", "-DNXBASE_BUILD_PYTHON=ON",
                   "-DNXBASE_BUILD_TESTS=OFF", "-DNXBASE_BUILD_BENCH=OFF",
                   "-DNXBASE_BUILD_TOOLS=OFF", "-DNXBASE_BUILD_FUZZ=OFF",
                   # The module at the top, the library beside it in nxbase.libs/.
                   "-DNXBASE_PYTHON_SITEARCH=site", "-DCMAKE_INSTALL_LIBDIR=site/nxbase.libs"]
        subprocess.run(["cmake", "-S", str(ROOT), "-B", str(build), "-G", "Ninja", *options],
                       check=True)
        subprocess.run(["cmake", "--build", str(build), "--target", "nxbase_python",
                        "-j", str(os.cpu_count() or 1)], check=True)
        shutil.rmtree(stage, ignore_errors=True)
        for component in ("runtime", "python"):
            subprocess.run(["cmake", "--install", str(build), "--component", component],
                           check=True)
        site = stage / "site"
        libs = target / "nxbase.libs"
        libs.mkdir(parents=True, exist_ok=True)
        # A wheel holds no links: the library once, under its SONAME.
        shutil.copyfile(site / "nxbase.libs" / "libnxbase.so.0", libs / "libnxbase.so.0")
        for item in site.iterdir():
            if item.is_file():
                shutil.copyfile(item, target / item.name)


# No Python packages of its own: the module is the extension.
setup(packages=[], py_modules=[], ext_modules=[Extension("nxbase", sources=[])],
      cmdclass={"build_ext": CMakeBuild})
