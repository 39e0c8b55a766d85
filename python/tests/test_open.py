"""Opening real files: values and active voxels as in the file."""

import numpy as np
import pytest

import vln


def test_requirement_a_file_is_a_mapping_of_names_to_channels(bunny):
    assert len(bunny) == 1 and list(bunny) == ["ls_bunny"] and "ls_bunny" in bunny
    channel = bunny["ls_bunny"]
    assert channel.type == "float" and channel.dtype == np.float32
    assert channel.box == ((-80, 25, -53), (54, 157, 52))
    assert channel.active_count == 235046
    with pytest.raises(KeyError, match="has no grid 'x'"):
        bunny["x"]


def test_requirement_dense_values_and_samples_agree(bunny):
    channel = bunny["ls_bunny"]
    dense = channel.to_numpy()
    assert dense.shape == (134, 132, 105) and dense.dtype == np.float32
    rng = np.random.default_rng(1)
    low = np.array(channel.box[0])
    ijk = low + rng.integers(0, dense.shape, (1000, 3))
    expected = dense[tuple((ijk - low).T)]
    assert np.array_equal(channel.get(ijk), expected)
    assert np.array_equal(channel.sample(ijk, space="index"), expected)
    world = bunny.volume.to_world(ijk)
    assert np.allclose(channel.sample(world), expected, atol=1e-9)
