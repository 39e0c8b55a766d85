"""read_nvtt.py FILE.nvtt GRID X Y Z: one value of a float grid, read without any library.

What docs/flat_buffer.md says, in so many lines; for arrays and speed there is the module of docs/python.md.
"""

# snippet: read
import mmap
import struct
import sys

NO_TILE, CHILD_BASE, TILE_TABLE = 0xFFFFFFFF, 1048736, 736


def value_at(path, name, x, y, z):
    with open(path, "rb") as file, mmap.mmap(file.fileno(), 0, access=mmap.ACCESS_READ) as data:
        def get(form, at):
            return struct.unpack_from("<" + form, data, at)[0]

        assert data[:8] == b"\x89NVTT\r\n\x1a", "not a flat file"
        buffer = get("Q", 80)

        # The grid of that name: grids lie one after the other behind the container.
        grid = buffer + get("Q", buffer + 8)
        while data[grid + 40:grid + 296].rstrip(b"\0").decode() != name:
            assert get("I", grid + 24) + 1 < get("I", grid + 28), "no such grid"
            grid += get("Q", grid + 32)
        assert get("I", grid + 636) == 1, "not a grid of floats"

        # The tile: from the slot in the root table down the child tables.
        depth = get("i", buffer + 1048724)
        p = [c - get("i", buffer + 1048712 + 4 * a) for a, c in enumerate((x, y, z))]
        slot = [c >> (30 - depth) for c in p]
        if not all(0 <= s < 64 for s in slot):
            return get("f", grid + 712)
        tile = get("I", buffer + 136 + 4 * (slot[0] + 64 * (slot[1] + 64 * slot[2])))
        if tile == NO_TILE:
            return get("f", grid + 712)
        while depth < 28:
            entry = get("Q", buffer + CHILD_BASE + 8 * tile)
            bits = (entry >> 56) + 1
            n = [c >> (30 - depth - bits) & (1 << bits) - 1 for c in p]
            table = buffer + CHILD_BASE + (entry & 0xFFFFFFFFFFFF)
            child = get("I", table + 4 * (n[0] + (n[1] << bits) + (n[2] << 2 * bits)))
            if child == NO_TILE:
                break
            tile, depth = child, depth + bits

        # The sample: a cube of `width` along an axis, of which 4 * 2^levels are the tile's own.
        entry = get("Q", grid + TILE_TABLE + 8 * tile)
        width, levels = entry >> 48 & 255, entry >> 56
        assert width, "textures are left out here"
        shift = 28 - depth - levels
        i, j, k = (c % (1 << 30 - depth) >> shift for c in p)
        return get("f", grid + TILE_TABLE + (entry & 0xFFFFFFFFFFFF) + 4 * (i + width * (j + width * k)))
# end snippet


if __name__ == "__main__":
    path, name, *place = sys.argv[1:]
    print(value_at(path, name, *map(int, place)))
