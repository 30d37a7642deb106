// Replacing the local queue with a whole source.
#ifndef TARN_CHANGESRC_H
#define TARN_CHANGESRC_H

class LocalPlayer;

int ChangeSourceRandom100(LocalPlayer *player, bool regenerate);
int ChangeSourceRadio(LocalPlayer *player);
int ChangeSourceIPod(LocalPlayer *player);
int ChangeSourceFirstPlaylist(LocalPlayer *player);
int ChangeSourceCustom(int slot, LocalPlayer *player);
int ChangeSourceNext(LocalPlayer *player);
int ChangeSourcePrevious(LocalPlayer *player);
int SaveCustomSource(int slot, LocalPlayer *player);

#endif
