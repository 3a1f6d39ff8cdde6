velk_fuzz(ipc_frames LINKS velk_ipc)
