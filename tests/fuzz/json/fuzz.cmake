velk_fuzz(json LINKS velk_foundation)
