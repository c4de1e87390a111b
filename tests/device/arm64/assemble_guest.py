#!/usr/bin/env python3
"""Assembles the emulated ARM64 device's root file system from Debian's
arm64 packages and the project's arm64-device build, and packs it as an
initramfs.

    assemble_guest.py WORK_DIR SOURCE_DIR BUILD_DIR OUTPUT_INITRAMFS OUTPUT_KERNEL PROJECT_DEBS...

WORK_DIR keeps the downloaded packages (reused by later runs) and the
unpacked root. The project's sources and build keep their absolute paths
in the guest, so that the test programs find what they were built with.
The project's own arm64 packages, PROJECT_DEBS, wait in PACKAGE_CACHE for
the guest's dpkg to install them at boot, into a package database that
holds the Debian packages the guest was assembled from. Only Debian's
package registry is reached (apt-get download).
"""

import os
import re
import shutil
import subprocess
import sys
from pathlib import Path

ARCH = "arm64"
TRIPLET = "aarch64-linux-gnu"

# Programs of the guest besides busybox, from the packages that hold them.
PROGRAM_PACKAGES = ["dash", "bash", "coreutils", "util-linux", "mount", "fdisk", "e2fsprogs", "dmsetup", "strace",
                    "f2fs-tools"]
PROGRAMS = [
    "bin/dash", "bin/bash", "bin/mountpoint", "sbin/sfdisk", "sbin/losetup", "bin/mount", "bin/umount", "usr/bin/unshare", "usr/bin/setpriv",
    "usr/bin/nsenter", "sbin/mke2fs", "sbin/e2fsck", "sbin/tune2fs", "sbin/dumpe2fs", "sbin/dmsetup",
    "usr/bin/strace", "sbin/mkfs.f2fs", "sbin/fsck.f2fs", "sbin/f2fs_io", "usr/sbin/filefrag", "usr/bin/fallocate",
]
# Every program of these directories of coreutils, ahead of busybox's.
WHOLE_PACKAGES = ["coreutils"]
# The C and C++ runtime for dynamically linked programs (test programs,
# the fault-injection shim), with the loader.
RUNTIME_PACKAGES = ["libc6", "libstdc++6", "libgcc-s1"]
# dpkg, with the programs it runs (sh, rm and diff come from dash,
# coreutils and diffutils) and the one library it needs besides lib*.
PACKAGE_MANAGER_PACKAGES = ["dpkg", "tar", "diffutils", "libc-bin", "zlib1g"]
PACKAGE_MANAGER_PROGRAMS = ["usr/bin/dpkg", "usr/bin/dpkg-deb", "usr/bin/dpkg-split", "usr/bin/dpkg-query", "sbin/start-stop-daemon",
                            "bin/tar", "usr/bin/diff", "sbin/ldconfig"]
# Where the project's packages wait to be installed, in the guest.
PACKAGE_CACHE = "var/cache/migrate-settings"

# The kernel's modules the guest loads, with what they need (modules.dep).
MODULES = ["sdhci-pci", "ext4", "crc32c_generic", "crc32_generic", "loop", "dm-mod", "dm-log-writes", "dm-snapshot", "dm-flakey",
           "f2fs", "vfat"]
# Modules a mode loads itself, with parameters of its own: the replay's RAM disks.
MODULES_ON_DEMAND = ["brd"]


def run(*args, **kwargs):
    return subprocess.run(args, check=True, text=True, **kwargs)


def output(*args):
    return run(*args, stdout=subprocess.PIPE).stdout


def kernel_package():
    text = output("apt-cache", "depends", f"linux-image-{ARCH}:{ARCH}")
    match = re.search(r"Depends: (linux-image-[0-9][^:\s]*-arm64)", text)
    if not match:
        sys.exit("assemble_guest: no kernel image package found for linux-image-arm64")
    return match.group(1)


def library_closure(packages):
    """The packages plus every lib* package they depend on, recursively."""
    wanted = list(packages)
    seen = set()
    while wanted:
        package = wanted.pop()
        if package in seen:
            continue
        seen.add(package)
        text = output("apt-cache", "depends", "--no-recommends", "--no-suggests", "--no-conflicts",
                      "--no-breaks", "--no-replaces", "--no-enhances", f"{package}:{ARCH}")
        for match in re.finditer(r"^\s+(?:Pre)?Depends: <?([a-z0-9][a-z0-9.+-]*)(?::[a-z0-9]+)?>?", text, re.M):
            name = match.group(1)
            if name.startswith("lib") and name not in seen:
                wanted.append(name)
    return sorted(seen)


def qualified(package):
    """The name apt downloads the arm64 build by; packages for all
    architectures have no arm64 build of their own."""
    policy = output("apt-cache", "policy", f"{package}:{ARCH}")
    return f"{package}:{ARCH}" if re.search(r"Candidate: [0-9]", policy) else package


def download(packages, debs):
    debs.mkdir(parents=True, exist_ok=True)
    have = {p.name.split("_")[0] for p in debs.glob("*.deb")}
    missing = [p for p in packages if p not in have]
    if missing:
        run("apt-get", "download", "-q", *[qualified(p) for p in missing], cwd=debs)
    return {p.name.split("_")[0]: p for p in debs.glob("*.deb")}


def extract(deb, into):
    into.mkdir(parents=True, exist_ok=True)
    run("dpkg-deb", "-x", str(deb), str(into))


def needed(elf):
    text = output("readelf", "-d", "-W", str(elf))
    return re.findall(r"\(NEEDED\)\s+Shared library: \[([^\]]+)\]", text)


LIBRARY_DIRS = [f"lib/{TRIPLET}", f"usr/lib/{TRIPLET}", "lib", "usr/lib"]


def find_library(unpacked, name):
    for directory in LIBRARY_DIRS:
        candidate = unpacked / directory / name
        if candidate.exists():
            return candidate
    return None


def copy_file(source, target):
    """Copies `source` to `target`, links resolved to the files they name."""
    target.parent.mkdir(parents=True, exist_ok=True)
    if target.exists() or target.is_symlink():
        target.unlink()
    shutil.copyfile(source.resolve(), target)
    shutil.copymode(source.resolve(), target)


def copy_with_libraries(unpacked, root, relative, copied):
    """Copies unpacked/relative into root with the libraries it needs."""
    source = unpacked / relative
    if not source.exists():
        sys.exit(f"assemble_guest: {relative} is in none of the unpacked packages")
    copy_file(source, root / relative)
    add_libraries(unpacked, root, source, copied)


def add_libraries(unpacked, root, elf, copied):
    for name in needed(elf):
        if name in copied:
            continue
        library = find_library(unpacked, name)
        if library is None:
            sys.exit(f"assemble_guest: {elf} needs {name}, found in no unpacked package")
        copied.add(name)
        copy_file(library, root / library.relative_to(unpacked))
        add_libraries(unpacked, root, library, copied)


def register_packages(root, debs):
    """A dpkg database that holds DEBS, the packages the guest's programs
    and libraries come from: their control fields, installed, with no file
    lists, since the guest carries only part of their files. dpkg checks
    the project's packages' dependencies against them."""
    database = root / "var" / "lib" / "dpkg"
    for directory in ("info", "updates", "triggers", "alternatives", "parts"):
        (database / directory).mkdir(parents=True, exist_ok=True)
    stanzas = []
    for deb in sorted(debs, key=lambda d: d.name):
        fields = output("dpkg-deb", "-f", str(deb)).rstrip("\n")
        package, _, rest = fields.partition("\n")
        stanzas.append(f"{package}\nStatus: install ok installed\n{rest}\n")
        name = package.split(": ", 1)[1]
        multi_arch_same = re.search(r"^Multi-Arch: same$", rest, re.M)
        (database / "info" / f"{name}{':' + ARCH if multi_arch_same else ''}.list").write_text("")
    (database / "status").write_text("\n".join(stanzas))
    (database / "available").write_text("")


def add_project_packages(root, project_debs):
    cache = root / PACKAGE_CACHE
    cache.mkdir(parents=True, exist_ok=True)
    for deb in project_debs:
        if dpkg_field(deb, "Architecture") != ARCH:
            sys.exit(f"assemble_guest: {deb} is not an {ARCH} package")
        copy_file(deb, cache / deb.name)


def dpkg_field(deb, field):
    return output("dpkg-deb", "-f", str(deb), field).strip()


def is_elf(path):
    with open(path, "rb") as file:
        return file.read(4) == b"\x7fELF"


def add_modules(unpacked, root, version):
    tree = unpacked / "lib" / "modules" / version
    # The package leaves modules.dep to the installing system's depmod.
    run("depmod", "-b", str(unpacked), version)
    dependencies = {}
    for line in (tree / "modules.dep").read_text().splitlines():
        module, _, needs = line.partition(":")
        dependencies[module] = needs.split()
    by_name = {Path(m).name.split(".ko")[0].replace("_", "-"): m for m in dependencies}
    wanted = []
    for name in MODULES + MODULES_ON_DEMAND:
        module = by_name.get(name.replace("_", "-"))
        if module is None:
            sys.exit(f"assemble_guest: no module {name} in {version}")
        wanted.append(module)
    chosen = set()
    while wanted:
        module = wanted.pop()
        if module not in chosen:
            chosen.add(module)
            wanted.extend(dependencies[module])
    for module in chosen:
        copy_file(tree / module, root / "lib" / "modules" / version / module)
    for name in ("modules.order", "modules.builtin", "modules.builtin.modinfo"):
        copy_file(tree / name, root / "lib" / "modules" / version / name)
    run("depmod", "-b", str(root), version)


def add_project(root, source, build, work):
    """The sources git knows and the build's programs and shared objects, at
    their own paths, without debug information."""
    files = output("git", "-C", str(source), "ls-files", "-z", "--cached", "--others", "--exclude-standard").split("\0")
    for relative in filter(None, files):
        path = source / relative
        if path.is_file():
            copy_file(path, root / path.relative_to("/"))
    for directory, subdirectories, names in os.walk(build):
        here = Path(directory)
        subdirectories[:] = [d for d in subdirectories if d != "CMakeFiles" and here / d != work]
        # Tests run in their build directory, which may hold no program.
        (root / here.relative_to("/")).mkdir(parents=True, exist_ok=True)
        for name in names:
            path = here / name
            if path.is_symlink() or not path.is_file() or not is_elf(path) or path.suffix in (".o", ".a"):
                continue
            target = root / path.relative_to("/")
            copy_file(path, target)
            run(f"{TRIPLET}-strip", "--strip-debug", str(target))


def main():
    work, source, build, initramfs, kernel_out = (Path(a).resolve() for a in sys.argv[1:6])
    project_debs = [Path(a).resolve() for a in sys.argv[6:]]
    if not project_debs:
        sys.exit("assemble_guest: no project packages given")
    debs = work / "debs"
    unpacked = work / "unpacked"
    root = work / "root"
    kernel = kernel_package()
    packages = library_closure(PROGRAM_PACKAGES + RUNTIME_PACKAGES + PACKAGE_MANAGER_PACKAGES) + ["busybox-static", kernel]
    available = download(packages, debs)

    shutil.rmtree(unpacked, ignore_errors=True)
    for package in packages:
        extract(available[package], unpacked)
    version = kernel[len("linux-image-"):]

    shutil.rmtree(root, ignore_errors=True)
    for directory in ("bin", "sbin", "usr/bin", "usr/sbin", "lib", "proc", "sys", "dev", "tmp", "run", "etc",
                      "media/boot", "media/resources", "media/static", "var/nonvolatile", "root"):
        (root / directory).mkdir(parents=True, exist_ok=True)
    copy_file(unpacked / "bin" / "busybox", root / "bin" / "busybox")

    copied = set()
    # The loader under the name programs ask for, as a file of its own.
    loader = find_library(unpacked, "ld-linux-aarch64.so.1")
    copy_file(loader, root / "lib" / "ld-linux-aarch64.so.1")
    copy_file(loader, root / "lib" / TRIPLET / "ld-linux-aarch64.so.1")
    for relative in PROGRAMS + PACKAGE_MANAGER_PROGRAMS:
        copy_with_libraries(unpacked, root, relative, copied)
    for package in WHOLE_PACKAGES:
        for line in output("dpkg-deb", "-c", str(available[package])).splitlines():
            path = line.split()[-1].lstrip("./")
            if re.match(r"^(usr/)?s?bin/[^/]+$", path) and (unpacked / path).is_file():
                copy_with_libraries(unpacked, root, path, copied)
    # The product runs the partitioning tool by this path.
    copy_file(root / "sbin" / "sfdisk", root / "usr" / "sbin" / "sfdisk")
    (root / "sbin" / "mkfs.ext4").symlink_to("mke2fs")
    # As on Debian: busybox's shell would run its own applets (mount) ahead
    # of PATH, where the tests put their stand-ins.
    (root / "bin" / "sh").symlink_to("dash")

    add_modules(unpacked, root, version)
    register_packages(root, [available[p] for p in packages if p != kernel])
    add_project_packages(root, project_debs)
    add_project(root, source, build, work)
    test_list = build / "arm64-device-tests.list"
    copy_file(test_list, root / test_list.relative_to("/"))
    # The project's programs need the C++ runtime wherever no package program did.
    for path in (root / build.relative_to("/")).rglob("*"):
        if path.is_file() and is_elf(path):
            add_libraries(unpacked, root, path, copied)

    guest = source / "tests" / "device" / "arm64"
    copy_file(guest / "init.sh", root / "init")
    (root / "etc" / "arm64-device.conf").write_text(
        f"source_dir='{source}'\nbuild_dir='{build}'\nmodules='{' '.join(MODULES)}'\n"
        f"packages='/{PACKAGE_CACHE}'\ninstalled_tools=/usr/bin\n")
    copy_file(guest / "fstab", root / "etc" / "fstab")
    (root / "etc" / "passwd").write_text("root:x:0:0:root:/root:/bin/sh\nnobody:x:65534:65534:nobody:/:/bin/sh\n")
    (root / "etc" / "group").write_text("root:x:0:\nnogroup:x:65534:\n")

    listing = subprocess.run(["find", "."], cwd=root, check=True, stdout=subprocess.PIPE).stdout
    # Uncompressed: the emulated CPU took a second of every boot to unpack
    # the compressed archive, and the power cuts boot the device each time.
    with open(initramfs, "wb") as out:
        packed = subprocess.run(["cpio", "-o", "-H", "newc", "--quiet"], cwd=root, input=listing, stdout=out)
        if packed.returncode != 0:
            sys.exit("assemble_guest: packing the initramfs failed")
    copy_file(unpacked / "boot" / f"vmlinuz-{version}", kernel_out)
    print(f"guest: kernel {version}, initramfs {initramfs.stat().st_size // 1024} KiB")


if __name__ == "__main__":
    main()
