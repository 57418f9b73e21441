# The commands of this project. Everything is built under build/<preset>; nothing is installed but by `setup` (packages
# of the distribution) and `install`.
#
#   make demo      see the whole thing work, on real parts
#   make test      build what is released and run every test

JOBS   ?= $(shell nproc)
PREFIX ?= /usr/local
TESTS  ?=
CTEST   = ctest -j$(JOBS) --no-tests=error --output-on-failure $(if $(TESTS),-R '$(TESTS)')

.DEFAULT_GOAL := help
.PHONY: help setup build demo test worlds board interop pictures asan tsan fuzz bench lint format install install-symbols uninstall deb deb-test clean

help:
	@echo 'make demo              set up, build, and show the main job on a private store'
	@echo 'make test              set up, build (release) and run every test; TESTS=regex runs some'
	@echo 'make worlds            three people, faults, kills and full disks (docs/reliability.md); SEEDS=1..20'
	@echo 'make board             every fault at every place, judged; writes docs/reliability.md; BOARD_SECONDS=600, BOARD_SEEDS=1,2,3'
	@echo 'make interop           the whole cycle on the WebDAV servers of others; writes docs/servers.md'
	@echo 'make pictures          take the pictures of docs/books.md anew: a real window on a screen of its own'
	@echo 'make asan, make tsan   the same tests under AddressSanitizer+UBSan, or ThreadSanitizer'
	@echo 'make fuzz              every fuzz target for SECONDS_EACH seconds (60)'
	@echo 'make bench             benchmarks, with the ratios to independent clients'
	@echo 'make lint              formatting, room order, clang-tidy; make format mends the first'
	@echo 'make build             only build (release)'
	@echo 'make install           install under PREFIX (/usr/local), DESTDIR is honoured'
	@echo 'make install-symbols   what a debugger wants to know of it, under PREFIX/lib/debug'
	@echo 'make uninstall         remove what was installed under PREFIX; what lies in homes stays'
	@echo 'make deb               Debian packages in build/release/packages, and those with the symbols; lintian looks at them'
	@echo 'make deb-test          install them in a fresh root, use, upgrade, remove and purge them (as root)'
	@echo 'make setup             install the Debian packages that building and testing need'
	@echo 'make clean             remove build/'

setup:
	@packaging/setup build test

build: setup
	cmake --preset release
	cmake --build --preset release -j$(JOBS)

demo: build
	demo/run build/release

test: build
	cd build/release && $(CTEST)

SEEDS ?= 1..20
worlds: build
	build/release/tests/worlds --seeds $(SEEDS) --jobs $(JOBS)

BOARD_SEEDS ?= 1
BOARD_SECONDS ?= 0
board: build
	build/release/tests/board --seeds $(BOARD_SEEDS) --seconds $(BOARD_SECONDS) --jobs $(JOBS) --table docs/reliability.md

interop: build
	@packaging/setup build test interop pictures
	tests/interop/all build/release docs/servers.md

pictures: build
	@packaging/setup build test pictures
	docs/pictures/take build/release

asan tsan: setup
	cmake --preset $@
	cmake --build --preset $@ -j$(JOBS)
	cd build/$@ && $(CTEST)

SECONDS_EACH ?= 60
fuzz:
	@packaging/setup build fuzz
	cmake --preset fuzz
	cmake --build --preset fuzz --target fuzz_targets -j$(JOBS)
	fuzz/run build/fuzz $(SECONDS_EACH)

bench:
	@packaging/setup build test bench
	cmake --preset bench
	cmake --build --preset bench -j$(JOBS)
	bench/all build/bench

lint:
	@packaging/setup build test lint
	cmake --preset release
	packaging/lint/run build/release

format:
	@packaging/setup lint
	git ls-files -- '*.h' '*.cpp' | xargs clang-format -i

# Does not build, so that `sudo make install` leaves no files of root in the tree.
install:
	@test -f build/release/build.ninja || { echo 'make install: nothing is built yet. Run "make build" first.' >&2; exit 1; }
	cmake --install build/release --prefix '$(PREFIX)'

install-symbols:
	@test -f build/release/build.ninja || { echo 'make install-symbols: nothing is built yet. Run "make build" first.' >&2; exit 1; }
	cmake --install build/release --prefix '$(PREFIX)' --component debug

# Takes away what `make install` and `make install-symbols` put there, file by file, and directories that are empty then.
uninstall:
	@test -f build/release/build.ninja || { echo 'make uninstall: it is told by the build what was installed. Run "make build" first.' >&2; exit 1; }
	packaging/uninstall build/release '$(PREFIX)'

deb: build
	@packaging/setup deb
	packaging/deb build/release

deb-test: build
	@packaging/setup deb
	tests/packages/run build/release

clean:
	rm -rf build
