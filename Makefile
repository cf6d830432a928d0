# Entry points: `make demo` runs the daemon's main job on this host; `make test` installs what is
# missing, checks the style, builds and runs every test, builds the tree again with clang, whose
# thread-safety analysis checks the locking annotations, and runs every fuzzer briefly.
# `make asan` / `make tsan` run the tests under the sanitizers in their own build folders;
# `make fuzz` runs every fuzzer for FUZZ_SECONDS (600) each.
BUILD ?= build
JOBS ?= $(shell nproc)
FUZZ_SECONDS ?= 600

.PHONY: deps build demo test clang fuzz asan tsan clean

deps:
	bash scripts/install-deps.sh

build: deps
	cmake -S . -B $(BUILD) $(CMAKE_ARGS)
	cmake --build $(BUILD) -j $(JOBS)

demo: build
	BUILD=$(BUILD) bash scripts/demo.sh

test: build clang
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS)
	bash scripts/fuzz.sh 20

fuzz: deps
	bash scripts/fuzz.sh $(FUZZ_SECONDS)

# clang with -Wthread-safety -Werror, then the naming rules over its compile database.
clang: deps
	bash scripts/check-style.sh
	CC=clang CXX=clang++ cmake -S . -B build-clang -DORVANE_BENCH=OFF -DCMAKE_EXPORT_COMPILE_COMMANDS=ON
	cmake --build build-clang -j $(JOBS)
	bash scripts/check-style.sh build-clang

asan:
	$(MAKE) build BUILD=build-asan CMAKE_ARGS="-DORVANE_ASAN=ON -DORVANE_BENCH=OFF"
	cd build-asan && ctest --output-on-failure -j $(JOBS)

tsan:
	$(MAKE) build BUILD=build-tsan CMAKE_ARGS="-DORVANE_TSAN=ON -DORVANE_BENCH=OFF"
	cd build-tsan && ctest --output-on-failure -j $(JOBS)

clean:
	rm -rf build build-asan build-tsan build-clang build-fuzz
