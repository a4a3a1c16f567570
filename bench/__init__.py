"""How fast and how small Pelorus is; `bench/run` shows it."""
