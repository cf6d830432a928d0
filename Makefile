# Entry points: `make demo` runs the daemon's main job on this host; `make test` installs what is
# missing, builds and runs every test; `make asan` / `make tsan` do the same under the sanitizers
# in their own build folders.
BUILD ?= build
JOBS ?= $(shell nproc)

.PHONY: deps build demo test asan tsan clean

deps:
	bash scripts/install-deps.sh

build: deps
	cmake -S . -B $(BUILD) $(CMAKE_ARGS)
	cmake --build $(BUILD) -j $(JOBS)

demo: build
	BUILD=$(BUILD) bash scripts/demo.sh

test: build
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS)

asan:
	$(MAKE) test BUILD=build-asan CMAKE_ARGS="-DORVANE_ASAN=ON -DORVANE_BENCH=OFF"

tsan:
	$(MAKE) test BUILD=build-tsan CMAKE_ARGS="-DORVANE_TSAN=ON -DORVANE_BENCH=OFF"

clean:
	rm -rf build build-asan build-tsan
